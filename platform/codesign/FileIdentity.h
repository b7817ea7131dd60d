#pragma once

// Which file a path or a descriptor is: its device and inode. Two names, or
// a name and an open descriptor, refer to the same file exactly when their
// identities are equal, whatever links, bind mounts or mount namespaces lie
// in between. Entitlements are bound to the file a process runs by this
// identity, not by the path it was started from.

#include <sys/types.h>

#include <optional>
#include <string>

namespace codesign {

struct FileIdentity {
  dev_t device = 0;
  ino_t inode = 0;

  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

// The identity of the file open as fd (an O_PATH descriptor is enough); none
// when fstat fails.
std::optional<FileIdentity> fileIdentityOf(int fd);

// The identity of the file at path, every link followed (a final link too);
// none when there is nothing there or it cannot be examined.
std::optional<FileIdentity> fileIdentityAt(const std::string& path);

}  // namespace codesign
