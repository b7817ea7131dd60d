#pragma once

// The identity of a process as the connection layer captured it when the
// process connected (its own audit token carries the same fields). Plain
// fields, so this folder does not depend on the connection layer.

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "platform/codesign/FileIdentity.h"

namespace codesign {

struct ProcessIdentity {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  // Start time of the process in clock ticks after boot (/proc/<pid>/stat
  // field 22), which tells a recycled pid from the process.
  uint64_t startTime = 0;
  // Absolute path of the executable, read from /proc/<pid>/exe at connection
  // time; empty when it could not be read. For finding the bundle and for
  // logs: what the process runs is executableFile.
  std::string executablePath;
  // The file the process runs, as opened through /proc/<pid>/exe; none when
  // it could not be opened (such a process has no entitlements).
  std::optional<FileIdentity> executableFile;
};

}  // namespace codesign
