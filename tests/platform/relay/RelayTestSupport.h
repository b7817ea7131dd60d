// Helpers of the relay tests: a private TENON_ROOT per test, waiting for
// what other threads record, a server that answers requests, and a plain
// socket client for raw bytes. Waits give up after 20 seconds so that a
// broken build fails instead of hanging; no test depends on speed.

#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/relay/FrameReader.h"
#include "platform/relay/Listener.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Value.h"

namespace relay::test {

inline constexpr std::chrono::seconds kPatience{20};

// A fresh directory as TENON_ROOT for the lifetime of the object.
class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  std::optional<std::string> previous_;
};

class RelayTest : public ::testing::Test {
 protected:
  TempRoot root_;
};

// Values recorded by other threads, with waiting.
template <typename T>
class Recorder {
 public:
  void add(T value) {
    const std::lock_guard lock(mutex_);
    values_.push_back(std::move(value));
    changed_.notify_all();
  }
  // Waits until at least `count` values are there; returns them all. Fails
  // the test (and returns what there is) when they do not come.
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
  std::size_t size() const {
    const std::lock_guard lock(mutex_);
    return values_.size();
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<T> values_;
};

// Polls `condition` until it holds; false after kPatience.
bool eventually(const std::function<bool()>& condition);

// Records a connection's events; install with connection->setEventHandler(recorder.handler()).
class EventRecorder : public Recorder<Event> {
 public:
  Connection::EventHandler handler() {
    return [this](const Event& event) { add(event); };
  }
  // The kinds recorded so far, in order.
  std::vector<Event::Kind> kinds() const;
  // Waits for an event of `kind`; false when none came.
  bool waitForKind(Event::Kind kind);
};

// A resumed listener whose connections answer each request with
// respond(request) when that returns a value (and do not answer when it
// returns null). Records the connections it accepted and their events.
class Server {
 public:
  using Responder = std::function<tn::Value(const Message&)>;

  Server(std::string serviceName, Responder respond);
  ~Server();

  // Echoes the body back as {"echo": body}.
  static tn::Value echo(const Message& request);

  Listener& listener() { return *listener_; }
  // The nth accepted connection (0-based), waiting for it.
  std::shared_ptr<Connection> connection(std::size_t index);
  // The events of the nth accepted connection.
  EventRecorder& events(std::size_t index);
  std::size_t connectionCount() const { return accepted_.size(); }

 private:
  struct Accepted {
    std::shared_ptr<Connection> connection;
    std::shared_ptr<EventRecorder> events;
  };

  Responder respond_;
  std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  std::shared_ptr<Listener> listener_;
  Recorder<Accepted> accepted_;
};

// A client connection to `serviceName`, resumed, with its events recorded.
struct Client {
  explicit Client(const std::string& serviceName);
  ~Client();
  // Sends and waits for the reply (or error).
  Reply request(tn::Value body);

  std::shared_ptr<tn::dispatch::SerialQueue> queue;
  std::shared_ptr<Connection> connection;
  EventRecorder events;
};

// A plain Unix socket connected to a service, for raw bytes.
class RawClient {
 public:
  explicit RawClient(const std::string& serviceName);
  bool connected() const { return fd_.valid(); }
  int fd() const { return fd_.get(); }
  // Writes all of `bytes` (blocking).
  void write(const tn::Bytes& bytes);
  // The next frame, or none at end of stream, on error or after kPatience.
  std::optional<RawFrame> readFrame();
  // True when the peer closes the connection within kPatience; frames that
  // arrive before are discarded.
  bool waitForClose();

 private:
  bool readExactly(uint8_t* out, std::size_t size);
  UniqueFd fd_;
};

// The socket path of a service under the current TENON_ROOT.
std::string pathOf(const std::string& serviceName);

}  // namespace relay::test
