#pragma once

// FrameSocket: a client of a relay service that speaks raw frames over a
// plain Unix socket, as a client in any language would: no client library,
// no threads of its own. The hostile-peer tests use it to do what the
// library never does (flood, never read); the benchmarks use it as the
// leanest possible client.
//
//   FrameSocket socket(daemon.socketPath());
//   Value reply = socket.request(Value(Dictionary{{"request", "find"}, {"version", 3}}));
//
// Sends block while the peer does not read, for at most 30 seconds (then
// they fail), so that a test of a daemon that stopped reading fails rather
// than hangs.

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <string>

#include "platform/relay/Frame.h"
#include "platform/value/Cbor.h"
#include "platform/value/Value.h"

namespace tn::test {

class FrameSocket {
 public:
  explicit FrameSocket(const std::string& socketPath) : fd_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    const timeval patience{30, 0};
    ::setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, socketPath.data(), std::min(socketPath.size(), sizeof address.sun_path - 1));
    connected_ = ::connect(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  }
  ~FrameSocket() { ::close(fd_); }
  FrameSocket(const FrameSocket&) = delete;
  FrameSocket& operator=(const FrameSocket&) = delete;

  bool connected() const { return connected_; }

  // A receive that waits as long as it takes, with a plain blocking read
  // (what benchmarks measure against a raw echo).
  static constexpr std::chrono::milliseconds kNoLimit = std::chrono::milliseconds::max();

  // Ends both directions: a send or receive blocked on the socket returns.
  void shutdown() { ::shutdown(fd_, SHUT_RDWR); }

  // Sends `frame` (encoded with any id) as the next request, numbered in
  // turn. False when the socket refused it.
  bool send(Bytes& frame) {
    relay::setFrameId(frame, ++lastId_);
    return writeAll(frame);
  }
  bool send(const Value& body) {
    tn::Result<Bytes> frame = relay::encodeFrame(body, 0, 1);
    return frame.ok() && send(*frame);
  }

  // Reads the next frame whole into `frame`; false when none came within
  // `patience`.
  bool receive(Bytes& frame, std::chrono::milliseconds patience = std::chrono::seconds(10)) {
    frame.resize(relay::kFrameHeaderSize);
    if (!readAll(frame.data(), relay::kFrameHeaderSize, patience)) return false;
    frame.resize(relay::kFrameLengthSize + relay::loadBigEndian32(frame.data()));
    return readAll(frame.data() + relay::kFrameHeaderSize, frame.size() - relay::kFrameHeaderSize, patience);
  }
  // The next frame's body, or null when none came within `patience`.
  Value receive(std::chrono::milliseconds patience = std::chrono::seconds(10)) {
    Bytes frame;
    if (!receive(frame, patience)) return Value();
    tn::Result<Value> decoded =
        decodeMessageBody(std::span<const uint8_t>(frame).subspan(relay::kFrameHeaderSize));
    return decoded.ok() ? *decoded : Value();
  }

  Value request(const Value& body) { return send(body) ? receive() : Value(); }

 private:
  bool writeAll(const Bytes& bytes) {
    for (std::size_t sent = 0; sent < bytes.size();) {
      const ssize_t n = ::send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (n <= 0) return false;
      sent += static_cast<std::size_t>(n);
    }
    return true;
  }
  bool readAll(uint8_t* out, std::size_t size, std::chrono::milliseconds patience) {
    for (std::size_t got = 0; got < size;) {
      pollfd ready{fd_, POLLIN, 0};
      if (patience != kNoLimit && ::poll(&ready, 1, static_cast<int>(patience.count())) != 1) return false;
      const ssize_t n = ::read(fd_, out + got, size - got);
      if (n <= 0) return false;
      got += static_cast<std::size_t>(n);
    }
    return true;
  }

  int fd_;
  bool connected_ = false;
  uint64_t lastId_ = 0;
};

}  // namespace tn::test
