#pragma once

// Replacing a file so that readers, and the file system after a crash, see
// either the old contents or the new, never a mixture or a truncated file.
// The stores (annotations, preferences, the registrar's documents) save
// through this.

#include <sys/types.h>

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace tn {

inline constexpr std::string_view kFileErrorDomain = "File";

// Writes contents to path atomically: into a new temporary file in the same
// directory (created exclusively, named ".<file name>.tmp-XXXXXX"), flushed
// to disk, given exactly mode (not filtered by the umask), renamed over path,
// and the directory flushed so the rename itself is durable.
//
// On failure returns an error of domain kFileErrorDomain whose code is the
// errno value and whose message names the path and the reason ("/x/a:
// cannot create a temporary file: Permission denied"); the temporary file is
// removed and path keeps its old contents (or stays absent). Only a failure
// to flush the directory after the rename leaves path already replaced.
//
// A symbolic link at path is replaced by the file, not followed.
Result<void> writeFileAtomically(const std::string& path, std::string_view contents, mode_t mode = 0644);

}  // namespace tn
