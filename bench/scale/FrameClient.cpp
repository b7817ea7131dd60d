#include "bench/scale/FrameClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "bench/scale/Failure.h"
#include "bench/scale/UnixSocket.h"
#include "platform/relay/Frame.h"
#include "platform/value/Cbor.h"
#include "platform/value/URL.h"

namespace tn::bench {

using Clock = std::chrono::steady_clock;

FrameClient::FrameClient(const std::string& path) : fd_(connectUnixSocket(path)) {}

FrameClient::~FrameClient() {
  if (fd_ >= 0) ::close(fd_);
}

bool FrameClient::roundTrip(Bytes& frame, Bytes& reply, std::chrono::milliseconds patience) {
  relay::setFrameId(frame, ++lastId_);
  for (std::size_t sent = 0; sent < frame.size();) {
    const ssize_t n = ::send(fd_, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
    if (n <= 0) return false;
    sent += static_cast<std::size_t>(n);
  }
  reply.resize(relay::kFrameHeaderSize);
  if (!readAll(reply.data(), relay::kFrameHeaderSize, patience)) return false;
  const uint32_t length = relay::loadBigEndian32(reply.data());
  if (length < relay::kFrameIdsSize || length > relay::kMaxFrameLength) return false;
  reply.resize(relay::kFrameLengthSize + length);
  return readAll(reply.data() + relay::kFrameHeaderSize, reply.size() - relay::kFrameHeaderSize, patience);
}

bool FrameClient::readAll(uint8_t* out, std::size_t size, std::chrono::milliseconds patience) {
  const bool waitForever = patience == std::chrono::milliseconds::max();
  const Clock::time_point deadline = waitForever ? Clock::time_point::max() : Clock::now() + patience;
  for (std::size_t got = 0; got < size;) {
    if (!waitForever) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
      pollfd ready{fd_, POLLIN, 0};
      if (left.count() <= 0 || ::poll(&ready, 1, static_cast<int>(left.count())) != 1) return false;
    }
    const ssize_t n = ::read(fd_, out + got, size - got);
    if (n <= 0) return false;
    got += static_cast<std::size_t>(n);
  }
  return true;
}

namespace {

Bytes findFrame(Dictionary request) {
  request.set("request", Value("find"));
  request.set("version", Value(3));
  Result<Bytes> frame = relay::encodeFrame(Value(std::move(request)), 0, 1);
  if (!frame.ok()) fail("cannot encode a find request: " + frame.error().description());
  return std::move(*frame);
}

}  // namespace

Bytes findByUUIDFrame(const UUID& uuid) { return findFrame(Dictionary{{"uuids", Value(uuid)}}); }

Bytes findByPathFrame(const std::string& bundlePath) {
  return findFrame(Dictionary{{"paths", Value(URL::fileURLWithPath(bundlePath).absoluteString())}});
}

bool isFoundReply(std::span<const uint8_t> frame, std::string* why) {
  if (frame.size() < relay::kFrameHeaderSize) {
    if (why) *why = "a reply shorter than a frame header";
    return false;
  }
  Result<Value> body = decodeMessageBody(frame.subspan(relay::kFrameHeaderSize));
  if (!body.ok() || !body->isDictionary()) {
    if (why) *why = "a reply that is not a dictionary";
    return false;
  }
  const bool found = body->dictionary()->find("matches") != nullptr && body->dictionary()->find("errorcode") == nullptr;
  if (!found && why) *why = body->description();
  return found;
}

Percentiles percentiles(std::vector<double> micros) {
  if (micros.empty()) return {};
  std::sort(micros.begin(), micros.end());
  return {micros[micros.size() / 2], micros[std::min(micros.size() - 1, micros.size() * 99 / 100)]};
}

std::vector<double> timeRoundTrips(const std::string& path, std::vector<Bytes> frames, std::size_t first,
                                   std::size_t count,
                                   const std::function<bool(std::span<const uint8_t>)>& check) {
  FrameClient client(path);
  if (!client.connected()) fail("cannot connect to " + path);
  std::vector<double> micros;
  micros.reserve(count);
  Bytes reply;
  for (std::size_t i = 0; i < count; ++i) {
    Bytes& frame = frames[(first + i) % frames.size()];
    const Clock::time_point start = Clock::now();
    if (!client.roundTrip(frame, reply)) fail("round trip " + std::to_string(i) + " to " + path + " failed");
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    std::string why;
    if (check && !check(reply)) {
      isFoundReply(reply, &why);
      fail("round trip " + std::to_string(i) + " to " + path + ": unexpected reply " + why);
    }
  }
  return micros;
}

}  // namespace tn::bench
