#include "tests/platform/relay/RelayTestSupport.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/relay/Frame.h"
#include "platform/relay/ServicePath.h"

namespace relay::test {

TempRoot::TempRoot() {
  // Short, because socket paths must fit a sockaddr_un.
  char pattern[] = "/tmp/relay-XXXXXX";
  const char* made = ::mkdtemp(pattern);
  if (made == nullptr) {
    ADD_FAILURE() << "mkdtemp: " << std::strerror(errno);
    return;
  }
  path_ = made;
  if (const char* previous = std::getenv("TENON_ROOT")) previous_ = previous;
  ::setenv("TENON_ROOT", path_.c_str(), 1);
}

TempRoot::~TempRoot() {
  if (previous_) ::setenv("TENON_ROOT", previous_->c_str(), 1);
  else ::unsetenv("TENON_ROOT");
  std::error_code ignored;
  if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
}

bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

std::vector<Event::Kind> EventRecorder::kinds() const {
  std::vector<Event::Kind> kinds;
  for (const Event& event : snapshot()) kinds.push_back(event.kind);
  return kinds;
}

bool EventRecorder::waitForKind(Event::Kind kind) {
  return eventually([&] {
    for (const Event::Kind seen : kinds()) {
      if (seen == kind) return true;
    }
    return false;
  });
}

Server::Server(std::string serviceName, Responder respond)
    : respond_(std::move(respond)), queue_(tn::dispatch::SerialQueue::create("test.listener")) {
  tn::Result<std::shared_ptr<Listener>> listener = Listener::create(std::move(serviceName), queue_);
  if (!listener.ok()) {
    ADD_FAILURE() << "Listener::create: " << listener.error().description();
    return;
  }
  listener_ = *listener;
  listener_->setNewConnectionHandler([this](std::shared_ptr<Connection> connection) {
    auto events = std::make_shared<EventRecorder>();
    const std::weak_ptr<Connection> weak = connection;
    connection->setEventHandler([this, events, weak](const Event& event) {
      events->add(event);
      const auto self = weak.lock();
      if (event.kind != Event::Kind::Message || !self || !respond_) return;
      tn::Value reply = respond_(event.message);
      if (!reply.isNull()) self->sendReply(event.message, std::move(reply));
    });
    connection->resume();
    accepted_.add({std::move(connection), std::move(events)});
  });
  listener_->resume();
}

Server::~Server() {
  if (listener_) listener_->cancel();
  queue_->sync([] {});  // no connection is admitted after this
  for (const Accepted& accepted : accepted_.snapshot()) accepted.connection->cancel();
  // Wait until the handlers are done with `this` (ConnectionInvalid is last).
  for (const Accepted& accepted : accepted_.snapshot()) {
    accepted.events->waitForKind(Event::Kind::ConnectionInvalid);
  }
}

tn::Value Server::echo(const Message& request) { return tn::Value(tn::Dictionary{{"echo", request.body}}); }

std::shared_ptr<Connection> Server::connection(std::size_t index) {
  const auto all = accepted_.waitFor(index + 1);
  return all.size() > index ? all[index].connection : nullptr;
}

EventRecorder& Server::events(std::size_t index) {
  const auto all = accepted_.waitFor(index + 1);
  static EventRecorder none;
  return all.size() > index ? *all[index].events : none;
}

Client::Client(const std::string& serviceName) : queue(tn::dispatch::SerialQueue::create("test.client")) {
  tn::Result<std::shared_ptr<Connection>> made = Connection::connectToService(serviceName, queue);
  if (!made.ok()) {
    ADD_FAILURE() << "connectToService: " << made.error().description();
    return;
  }
  connection = *made;
  connection->setEventHandler(events.handler());
  connection->resume();
}

Client::~Client() {
  if (!connection) return;
  connection->cancel();
  events.waitForKind(Event::Kind::ConnectionInvalid);
}

Reply Client::request(tn::Value body) {
  // Shared with the handler, which may outlive this call when the reply is late.
  struct Wait {
    std::optional<Reply> reply;
    tn::dispatch::Semaphore done;
  };
  const auto wait = std::make_shared<Wait>();
  const auto replyQueue = tn::dispatch::SerialQueue::create("test.reply");
  connection->sendWithReply(std::move(body), replyQueue, [wait](Reply received) {
    wait->reply = std::move(received);
    wait->done.signal();
  });
  if (!wait->done.waitFor(std::chrono::duration_cast<std::chrono::milliseconds>(kPatience))) {
    ADD_FAILURE() << "no reply";
    return tn::Error("test", 1, "no reply");
  }
  return *wait->reply;
}

RawClient::RawClient(const std::string& serviceName) : fd_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  const std::string path = pathOf(serviceName);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (::connect(fd_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) fd_.reset();
}

void RawClient::write(const tn::Bytes& bytes) {
  std::size_t written = 0;
  while (written < bytes.size()) {
    const ssize_t n = ::send(fd_.get(), bytes.data() + written, bytes.size() - written, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // the peer is gone; the test looks at that separately
    written += static_cast<std::size_t>(n);
  }
}

bool RawClient::readExactly(uint8_t* out, std::size_t size) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  std::size_t got = 0;
  while (got < size) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd entry{fd_.get(), POLLIN, 0};
    if (::poll(&entry, 1, static_cast<int>(left.count())) <= 0) continue;
    const ssize_t n = ::recv(fd_.get(), out + got, size - got, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    got += static_cast<std::size_t>(n);
  }
  return true;
}

std::optional<RawFrame> RawClient::readFrame() {
  uint8_t header[kFrameHeaderSize];
  if (!readExactly(header, sizeof header)) return std::nullopt;
  RawFrame frame;
  frame.id = loadBigEndian64(header + kFrameLengthSize);
  frame.replyTo = loadBigEndian64(header + kFrameLengthSize + 8);
  frame.body.resize(loadBigEndian32(header) - kFrameIdsSize);
  if (!readExactly(frame.body.data(), frame.body.size())) return std::nullopt;
  return frame;
}

bool RawClient::waitForClose() {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  uint8_t buffer[4096];
  while (std::chrono::steady_clock::now() < deadline) {
    pollfd entry{fd_.get(), POLLIN, 0};
    if (::poll(&entry, 1, 100) <= 0) continue;
    const ssize_t n = ::recv(fd_.get(), buffer, sizeof buffer, 0);
    if (n == 0 || (n < 0 && errno != EINTR && errno != EAGAIN)) return true;
  }
  return false;
}

std::string pathOf(const std::string& serviceName) {
  tn::Result<std::string> path = servicePath(serviceName);
  return path.ok() ? *path : std::string();
}

}  // namespace relay::test
