#pragma once

// The baseline of the scale benchmark: a raw Unix-socket echo. One thread
// accepts connections on a socket path and writes back every frame it
// reads on each, with one write per frame, as soon as the frame is whole
// (epoll): what any server on Unix sockets pays at the least to answer a
// request, with no work of its own.

#include <atomic>
#include <string>
#include <thread>

#include "platform/value/Value.h"

namespace tn::bench {

class EchoServer {
 public:
  // Listens on `path` (which must not exist) and starts the thread.
  explicit EchoServer(std::string path);
  // Stops the thread, closes every socket and removes `path`.
  ~EchoServer();
  EchoServer(const EchoServer&) = delete;
  EchoServer& operator=(const EchoServer&) = delete;

  const std::string& path() const { return path_; }

 private:
  void serve();
  // False when the connection ended (closed by then).
  bool echo(int fd, Bytes& pending);

  std::string path_;
  int listener_ = -1;
  int epoll_ = -1;
  int stopEvent_ = -1;
  std::thread thread_;
};

}  // namespace tn::bench
