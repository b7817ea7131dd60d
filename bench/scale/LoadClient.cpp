#include "bench/scale/LoadClient.h"

#include <sys/epoll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "bench/scale/Failure.h"
#include "bench/scale/UnixSocket.h"
#include "platform/relay/Frame.h"

namespace tn::bench {
namespace {

using Clock = std::chrono::steady_clock;

int connectNonBlocking(const std::string& path) {
  const int fd = connectUnixSocket(path);
  if (fd < 0) fail("the load client cannot connect to " + path + ": " + std::strerror(errno));
  const int one = 1;
  ::ioctl(fd, FIONBIO, &one);
  return fd;
}

// One connection: what it read and has not parsed, what it has still to
// write, the id of its last request.
struct Stream {
  int fd = -1;
  Bytes in;
  std::size_t parsed = 0;
  Bytes out;
  std::size_t written = 0;
  uint64_t lastId = 0;
  bool wantsWrite = false;
};

class Load {
 public:
  Load(const std::string& path, const std::vector<Bytes>& frames, const LoadOptions& options)
      : frames_(frames), options_(options), epoll_(::epoll_create1(EPOLL_CLOEXEC)) {
    streams_.resize(static_cast<std::size_t>(options.connections));
    for (std::size_t i = 0; i < streams_.size(); ++i) {
      streams_[i].fd = connectNonBlocking(path);
      epoll_event event{EPOLLIN, {.u64 = i}};
      ::epoll_ctl(epoll_, EPOLL_CTL_ADD, streams_[i].fd, &event);
    }
  }
  ~Load() {
    for (const Stream& stream : streams_) ::close(stream.fd);
    ::close(epoll_);
  }

  LoadResult run() {
    for (std::size_t i = 0; i < streams_.size(); ++i) {
      for (int d = 0; d < options_.depth; ++d) queueRequest(streams_[i]);
      flush(i);
    }
    const Clock::time_point start = Clock::now();
    const Clock::time_point measuredFrom = start + options_.warmUp;
    const Clock::time_point end = measuredFrom + options_.measured;
    uint64_t repliesAtStart = 0;
    bool measuring = false;
    for (Clock::time_point now = start; now < end; now = Clock::now()) {
      failIfInterrupted();
      if (!measuring && now >= measuredFrom) {
        measuring = true;
        repliesAtStart = replies_;
      }
      poll();
    }
    const uint64_t replies = replies_ - repliesAtStart;
    return {replies, static_cast<double>(replies) / std::chrono::duration<double>(options_.measured).count()};
  }

 private:
  void poll() {
    epoll_event events[64];
    const int ready = ::epoll_wait(epoll_, events, 64, 100);
    if (ready < 0 && errno != EINTR) fail("epoll_wait failed in the load client");
    for (int i = 0; i < ready; ++i) {
      const std::size_t index = events[i].data.u64;
      if (events[i].events & (EPOLLIN | EPOLLHUP | EPOLLERR)) readReplies(streams_[index]);
      flush(index);
    }
  }

  void queueRequest(Stream& stream) {
    const Bytes& frame = frames_[next_++ % frames_.size()];
    const std::size_t at = stream.out.size();
    stream.out.insert(stream.out.end(), frame.begin(), frame.end());
    relay::setFrameId(std::span<uint8_t>(stream.out).subspan(at, frame.size()), ++stream.lastId);
  }

  // Parses every whole reply read so far; each one sends the next request.
  void readReplies(Stream& stream) {
    uint8_t buffer[65536];
    const ssize_t n = ::read(stream.fd, buffer, sizeof buffer);
    if (n == 0) fail("the server closed a connection of the load client");
    if (n < 0) {
      if (errno == EAGAIN || errno == EINTR) return;
      fail(std::string("the load client's read failed: ") + std::strerror(errno));
    }
    stream.in.insert(stream.in.end(), buffer, buffer + n);
    while (stream.in.size() - stream.parsed >= relay::kFrameLengthSize) {
      const std::size_t size = relay::kFrameLengthSize + relay::loadBigEndian32(stream.in.data() + stream.parsed);
      if (stream.in.size() - stream.parsed < size) break;
      const std::span<const uint8_t> reply(stream.in.data() + stream.parsed, size);
      ++replies_;
      if (options_.check && replies_ % static_cast<uint64_t>(options_.checkEvery) == 0 && !options_.check(reply)) {
        fail("the load client got an unexpected reply");
      }
      stream.parsed += size;
      queueRequest(stream);
    }
    stream.in.erase(stream.in.begin(), stream.in.begin() + static_cast<std::ptrdiff_t>(stream.parsed));
    stream.parsed = 0;
  }

  // Writes what the stream has queued; asks for EPOLLOUT only while some
  // of it has to wait.
  void flush(std::size_t index) {
    Stream& stream = streams_[index];
    while (stream.written < stream.out.size()) {
      const ssize_t n = ::send(stream.fd, stream.out.data() + stream.written, stream.out.size() - stream.written,
                               MSG_NOSIGNAL);
      if (n < 0 && errno == EAGAIN) break;
      if (n <= 0) fail(std::string("the load client's write failed: ") + std::strerror(errno));
      stream.written += static_cast<std::size_t>(n);
    }
    if (stream.written == stream.out.size()) {
      stream.out.clear();
      stream.written = 0;
    }
    const bool wantsWrite = !stream.out.empty();
    if (wantsWrite != stream.wantsWrite) {
      stream.wantsWrite = wantsWrite;
      epoll_event event{wantsWrite ? uint32_t{EPOLLIN | EPOLLOUT} : uint32_t{EPOLLIN}, {.u64 = index}};
      ::epoll_ctl(epoll_, EPOLL_CTL_MOD, stream.fd, &event);
    }
  }

  const std::vector<Bytes>& frames_;
  const LoadOptions& options_;
  int epoll_;
  std::vector<Stream> streams_;
  std::size_t next_ = 0;
  uint64_t replies_ = 0;
};

}  // namespace

LoadResult runLoad(const std::string& path, const std::vector<Bytes>& frames, const LoadOptions& options) {
  if (frames.empty() || options.connections <= 0 || options.depth <= 0) fail("the load client has nothing to send");
  Load load(path, frames, options);
  return load.run();
}

}  // namespace tn::bench
