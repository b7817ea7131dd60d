// Helpers of the relay tests: a private TENON_ROOT per test, waiting for
// what other threads record, a server that answers requests, a client, raw
// frames and a plain socket for speaking the wire directly. Waits give up
// after 20 seconds so that a broken build fails instead of hanging; no test
// depends on speed.

#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/TempDirectory.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/log/CaptureSink.h"
#include "platform/relay/Connection.h"
#include "platform/relay/FrameReader.h"
#include "platform/relay/Listener.h"

namespace relay::test {

inline constexpr std::chrono::seconds kPatience{20};

using TempRoot = tn::test::TempRoot;

// Tests with sockets: a private root; the log captured (violations are
// logged as errors, and tests may assert on them).
class RelayTest : public ::testing::Test {
 protected:
  TempRoot root_;
  tn::log::ScopedCaptureSink log_;
};

// Polls `condition` until it holds; false after kPatience.
bool eventually(const std::function<bool()>& condition);

// Values recorded by other threads.
template <typename T>
class Recorder {
 public:
  void add(T value) {
    const std::lock_guard lock(mutex_);
    values_.push_back(std::move(value));
    changed_.notify_all();
  }
  // Waits until there are at least `count` values; returns them all.
  std::vector<T> waitFor(std::size_t count) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, kPatience, [&] { return values_.size() >= count; })) {
      ADD_FAILURE() << "waited for " << count << " values, got " << values_.size();
    }
    return values_;
  }
  std::vector<T> snapshot() const {
    const std::lock_guard lock(mutex_);
    return values_;
  }
  std::size_t size() const { return snapshot().size(); }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<T> values_;
};

// A connection's events: connection->setEventHandler(recorder.handler()).
// What is recorded is for looking at, so it does not keep the requests'
// share of the connection's inbound budget (Message::charge).
class EventRecorder : public Recorder<Event> {
 public:
  Connection::EventHandler handler() {
    return [this](const Event& event) { record(event); };
  }
  void record(Event event) {
    event.message.charge.reset();
    add(std::move(event));
  }
  std::vector<Event::Kind> kinds() const;
  int count(Event::Kind kind) const;
  // Waits for an event of `kind`; false when none came.
  bool waitForKind(Event::Kind kind);
};

// A resumed listener whose connections answer each request with
// respond(request), unless that is null (no reply).
class Server {
 public:
  using Responder = std::function<tn::Value(const Message&)>;
  Server(std::string serviceName, Responder respond);
  ~Server();  // cancels the listener and every connection it made
  static tn::Value echo(const Message& request);  // {"echo": body}

  Listener& listener() { return *listener_; }
  // The nth accepted connection (from 0), and its events, waiting for it.
  std::shared_ptr<Connection> connection(std::size_t index);
  EventRecorder& events(std::size_t index);
  std::size_t connectionCount() const { return accepted_.size(); }

 private:
  struct Accepted {
    std::shared_ptr<Connection> connection;
    std::shared_ptr<EventRecorder> events;
  };
  Responder respond_;
  std::shared_ptr<tn::dispatch::SerialQueue> queue_ = tn::dispatch::SerialQueue::create("test.listener");
  std::shared_ptr<Listener> listener_;
  Recorder<Accepted> accepted_;
};

// A resumed client connection with its events recorded; cancelled at the end.
struct Client {
  explicit Client(const std::string& serviceName);
  ~Client();
  Reply request(tn::Value body);  // sends and waits for the reply or error

  std::shared_ptr<Connection> connection;
  EventRecorder events;
};

// Frames with any header values; the body may be any CBOR (or none).
tn::Bytes rawFrameWithBody(uint64_t id, uint64_t replyTo, const tn::Bytes& body);
tn::Bytes rawFrame(uint64_t id, uint64_t replyTo, const tn::Value& body);
// A map body nesting `depth` maps in total ({"k": {"k": ...}}).
tn::Bytes nestedBody(int depth);
tn::Value numbered(uint64_t n);  // {"n": n}

// A plain Unix socket connected to a socket path, for raw bytes.
class RawClient {
 public:
  explicit RawClient(const std::string& socketPath);
  bool connected() const { return fd_.valid(); }
  void write(const tn::Bytes& bytes);
  // The next frame; none at end of stream or after kPatience.
  std::optional<RawFrame> readFrame();
  // True when the peer closes within kPatience (frames before are skipped).
  bool waitForClose();
  void close() { fd_.reset(); }
  int fd() const { return fd_.get(); }

 private:
  bool readExactly(uint8_t* out, std::size_t size);
  UniqueFd fd_;
};

// The socket path of a service under the current TENON_ROOT.
std::string pathOf(const std::string& serviceName);

}  // namespace relay::test
