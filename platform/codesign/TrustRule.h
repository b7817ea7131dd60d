#pragma once

// The trust rule for entitlement documents and executables: a file counts
// only when nobody but root and the daemon's own user can have written it.
// That is, the file
//   - is a regular file owned by root or by the trusted user,
//   - is not writable by group or others,
// and every directory from the one holding it up to "/" (after resolving
// links, so the directories checked are the ones the file really is in)
//   - is owned by root or by the trusted user, and
//   - is not writable by group or others, unless it has the sticky bit (in a
//     sticky directory such as /tmp others can add entries but cannot
//     replace or rename ours).
// The checks run on the open file, so what is checked is what is read.

#include <sys/types.h>

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace codesign {

inline constexpr std::string_view kCodesignErrorDomain = "Codesign";

enum class CodesignErrorCode : int64_t {
  Untrusted = 1,     // the trust rule refused a file; the message says why
  NoExecutable = 2,  // the process's executable is unknown
};

// Checks the file open as fd against the rule; trustedUser is the user
// trusted besides root. On refusal, an Untrusted error whose message is the
// reason ("writable by group or others (mode 0664)", "directory /tmp/x is
// writable by others and not sticky (mode 0777)", ...). fd may be an O_PATH
// descriptor.
tn::Result<void> checkTrustedFile(int fd, uid_t trustedUser);

// Checks the file at path (links followed) as checkTrustedFile does. The file
// is opened as a path only, so nothing is read and a FIFO cannot block.
tn::Result<void> checkTrustedPath(const std::string& path, uid_t trustedUser);

}  // namespace codesign
