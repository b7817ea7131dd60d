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

// What names a temporary file of writeFileAtomically: ".<file name>" then
// this marker then six random characters.
inline constexpr std::string_view kTemporaryMarker = ".tenon-tmp.";

// Writes contents to path atomically: into a new temporary file in the same
// directory (created exclusively with mode 0600, named
// ".<file name>.tenon-tmp.XXXXXX", and locked with flock for as long as it
// is open), flushed to disk, given exactly mode (not filtered by the umask),
// renamed over path, and the directory flushed so the rename itself is
// durable.
//
// On failure returns an error of domain kFileErrorDomain whose code is the
// errno value and whose message names the path and the reason ("/x/a:
// cannot create a temporary file: Permission denied"); the temporary file is
// removed and path keeps its old contents (or stays absent). Only a failure
// to flush the directory after the rename leaves path already replaced.
//
// A symbolic link at path is replaced by the file, not followed.
Result<void> writeFileAtomically(const std::string& path, std::string_view contents, mode_t mode = 0644);

// As writeFileAtomically, but only when nothing is at path yet: the file
// appears whole under path (link(), not rename()), and of several processes
// creating it at once exactly one succeeds; the others get code EEXIST.
Result<void> createFileAtomically(const std::string& path, std::string_view contents, mode_t mode = 0644);

// Removes the temporary files that writers killed during a save left in
// directory (any file's, not one target's): regular files named like
// writeFileAtomically's whose lock can be taken at once, so their writer is
// gone. A live writer's file (locked) is kept, and so are links and other
// names. Safe while other processes write. Returns how many were removed, or
// an error naming the directory when it cannot be listed.
Result<size_t> removeStaleTemporaryFiles(const std::string& directory);

}  // namespace tn
