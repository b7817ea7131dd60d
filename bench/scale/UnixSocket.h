#pragma once

// The scale benchmark's Unix sockets: the address of a socket path, and a
// stream socket connected to one (the echo binds the first; both clients
// use the second).

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <string>

namespace tn::bench {

// None when `path` does not fit in an address.
inline std::optional<sockaddr_un> unixSocketAddress(const std::string& path) {
  sockaddr_un address{};
  if (path.size() >= sizeof address.sun_path) return std::nullopt;
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());
  return address;
}

// A blocking stream socket connected to `path`, or -1 with errno set.
inline int connectUnixSocket(const std::string& path) {
  const std::optional<sockaddr_un> address = unixSocketAddress(path);
  if (!address) {
    errno = ENAMETOOLONG;
    return -1;
  }
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (::connect(fd, reinterpret_cast<const sockaddr*>(&*address), sizeof *address) != 0) {
    const int error = errno;
    ::close(fd);
    errno = error;
    return -1;
  }
  return fd;
}

}  // namespace tn::bench
