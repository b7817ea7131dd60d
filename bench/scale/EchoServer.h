#pragma once

// The baseline of the scale benchmark: a raw Unix-socket echo. One process
// of one thread accepts connections on a socket path and writes back every
// frame it reads on each, with one write per frame, as soon as the frame is
// whole (epoll): what any server on Unix sockets pays at the least to
// answer a request, with no work of its own.
//
// It is a process of its own, as the daemon is: a thread of the client's
// process is woken on the client's processor, a wake-up that costs a third
// of a separate process's on a virtual machine, so an echo in the client's
// process would not measure the socket a daemon's clients use.

#include <sys/types.h>

#include <string>

#include "platform/value/Value.h"

namespace tn::bench {

class EchoServer {
 public:
  // Listens on `path` (which must not exist) and starts the process.
  explicit EchoServer(std::string path);
  // Stops the process, closes every socket and removes `path`.
  ~EchoServer();
  EchoServer(const EchoServer&) = delete;
  EchoServer& operator=(const EchoServer&) = delete;

  const std::string& path() const { return path_; }
  pid_t pid() const { return process_; }

 private:
  void serve();
  // False when the connection ended (closed by then).
  bool echo(int fd, Bytes& pending);

  std::string path_;
  int listener_ = -1;
  int epoll_ = -1;
  int stopEvent_ = -1;
  pid_t process_ = -1;
};

}  // namespace tn::bench
