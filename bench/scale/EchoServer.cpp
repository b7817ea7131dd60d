#include "bench/scale/EchoServer.h"

#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <exception>
#include <map>
#include <string>

#include "bench/scale/Failure.h"
#include "bench/scale/UnixSocket.h"
#include "platform/relay/Frame.h"

namespace tn::bench {

EchoServer::EchoServer(std::string path) : path_(std::move(path)) {
  const std::optional<sockaddr_un> address = unixSocketAddress(path_);
  if (!address) fail("echo socket path too long: " + path_);
  listener_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (::bind(listener_, reinterpret_cast<const sockaddr*>(&*address), sizeof *address) != 0 ||
      ::listen(listener_, 128) != 0) {
    ::close(listener_);
    fail("the echo cannot listen on " + path_ + ": " + std::strerror(errno));
  }
  epoll_ = ::epoll_create1(EPOLL_CLOEXEC);
  stopEvent_ = ::eventfd(0, EFD_CLOEXEC);
  for (const int fd : {listener_, stopEvent_}) {
    epoll_event event{EPOLLIN, {.fd = fd}};
    ::epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event);
  }
  process_ = ::fork();
  if (process_ < 0) fail(std::string("the echo cannot start: ") + std::strerror(errno));
  if (process_ == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);  // never outlives the benchmark
    serve();
    ::_exit(0);
  }
}

EchoServer::~EchoServer() {
  const uint64_t one = 1;
  if (::write(stopEvent_, &one, sizeof one) != sizeof one) std::terminate();
  ::waitpid(process_, nullptr, 0);
  for (const int fd : {listener_, epoll_, stopEvent_}) ::close(fd);
  ::unlink(path_.c_str());
}

void EchoServer::serve() {
  std::map<int, Bytes> connections;  // with the bytes of a frame not yet whole
  epoll_event events[64];
  for (;;) {
    const int ready = ::epoll_wait(epoll_, events, 64, -1);
    if (ready < 0 && errno == EINTR) continue;
    for (int i = 0; i < ready; ++i) {
      const int fd = events[i].data.fd;
      if (fd == stopEvent_) {
        for (const auto& connection : connections) ::close(connection.first);
        return;
      }
      if (fd == listener_) {
        for (int accepted; (accepted = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC)) >= 0;) {
          epoll_event event{EPOLLIN, {.fd = accepted}};
          ::epoll_ctl(epoll_, EPOLL_CTL_ADD, accepted, &event);
          connections[accepted].clear();
        }
      } else if (!echo(fd, connections[fd])) {
        connections.erase(fd);
      }
    }
  }
}

// Reads what is there and writes back each whole frame read so far with
// a write of its own, as a server answers each request with its reply
// (blocking on the write only if the client does not read its echoes,
// which this benchmark's clients always do).
bool EchoServer::echo(int fd, Bytes& pending) {
  uint8_t buffer[65536];
  const ssize_t n = ::read(fd, buffer, sizeof buffer);
  if (n <= 0) {
    ::close(fd);  // also leaves the epoll set
    return false;
  }
  pending.insert(pending.end(), buffer, buffer + n);
  std::size_t parsed = 0;
  while (pending.size() - parsed >= relay::kFrameLengthSize) {
    const std::size_t size = relay::kFrameLengthSize + relay::loadBigEndian32(pending.data() + parsed);
    if (pending.size() - parsed < size) break;
    for (std::size_t sent = 0; sent < size;) {
      const ssize_t written = ::send(fd, pending.data() + parsed + sent, size - sent, MSG_NOSIGNAL);
      if (written <= 0) {
        ::close(fd);
        return false;
      }
      sent += static_cast<std::size_t>(written);
    }
    parsed += size;
  }
  pending.erase(pending.begin(), pending.begin() + static_cast<std::ptrdiff_t>(parsed));
  return true;
}

}  // namespace tn::bench
