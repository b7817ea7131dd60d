// What the service tests share: a private platform root made trusted, a
// client connection kept open, and waiting for a socket to accept.

#pragma once

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <future>
#include <memory>
#include <string>
#include <thread>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "tests/support/TempDirectory.h"
#include "tests/support/TrustedInstall.h"

namespace tn::test {

// True once a connection to the socket at `path` succeeds; false after 10 s.
inline bool socketAccepts(const std::string& path) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (std::chrono::steady_clock::now() < deadline) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const bool connected = ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
    ::close(fd);
    if (connected) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return false;
}

// True once a file exists at `path`; false after 10 s.
inline bool appears(const std::string& path) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  struct stat status {};
  while (::stat(path.c_str(), &status) != 0) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return true;
}

// Writes the daemon's configuration document under root, trusted.
inline void writeConfiguration(const std::string& root, const std::string& json) {
  const std::string path = root + "/etc/tenon/tenond.manifest";
  trustDirectoriesBetween(root, path);
  std::ofstream(path) << json;
  ::chmod(path.c_str(), 0644);
}

// A client connection to a service, kept open until close().
class OpenClient {
 public:
  explicit OpenClient(const std::string& service) : queue_(tn::dispatch::SerialQueue::create("test.client")) {
    auto connection = relay::Connection::connectToService(service, queue_);
    if (!connection.ok()) return;
    connection_ = *connection;
    connection_->setEventHandler([](const relay::Event&) {});
    connection_->resume();
  }
  ~OpenClient() { close(); }
  OpenClient(const OpenClient&) = delete;
  OpenClient& operator=(const OpenClient&) = delete;

  void close() {
    if (connection_) connection_->cancel();
    connection_.reset();
  }

  // The reply to the request (version 3), or {"error": ...} after 30 s.
  Value request(Dictionary request) {
    auto promise = std::make_shared<std::promise<Value>>();
    std::future<Value> reply = promise->get_future();
    if (!connection_) return Dictionary{{"error", "not connected"}};
    request.set("version", 3);
    connection_->sendWithReply(Value(std::move(request)), queue_, [promise](relay::Reply answer) {
      promise->set_value(answer.ok() ? *answer : Value(Dictionary{{"error", answer.error().description()}}));
    });
    if (reply.wait_for(std::chrono::seconds(30)) != std::future_status::ready) return Dictionary{{"error", "no reply"}};
    return reply.get();
  }

  // A hold on nothing: a hold all the same, which lasts while the
  // connection does.
  Value holdNothing() { return request({{"request", "lock"}, {"paths", Array{}}, {"flags", 0}}); }

 private:
  std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  std::shared_ptr<relay::Connection> connection_;
};

}  // namespace tn::test
