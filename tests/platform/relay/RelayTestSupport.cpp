#include "tests/platform/relay/RelayTestSupport.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/relay/Frame.h"
#include "platform/relay/ServicePath.h"
#include "platform/value/Cbor.h"

namespace relay::test {

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

int EventRecorder::count(Event::Kind kind) const {
  const auto all = kinds();
  return static_cast<int>(std::count(all.begin(), all.end(), kind));
}

bool EventRecorder::waitForKind(Event::Kind kind) {
  return eventually([&] { return count(kind) > 0; });
}

Server::Server(std::string serviceName, Responder respond) : respond_(std::move(respond)) {
  auto listener = Listener::create(std::move(serviceName), queue_);
  if (!listener.ok()) {
    ADD_FAILURE() << listener.error().description();
    return;
  }
  listener_ = *listener;
  listener_->setNewConnectionHandler([this](std::shared_ptr<Connection> connection) {
    auto events = std::make_shared<EventRecorder>();
    connection->setEventHandler([this, events, weak = std::weak_ptr(connection)](const Event& event) {
      events->record(event);
      const auto self = weak.lock();
      if (event.kind != Event::Kind::Message || !self || !respond_) return;
      if (tn::Value reply = respond_(event.message); !reply.isNull()) self->sendReply(event.message, reply);
    });
    connection->resume();
    accepted_.add({std::move(connection), std::move(events)});
  });
  listener_->resume();
}

Server::~Server() {
  if (listener_) listener_->cancel();
  queue_->sync([] {});  // nothing is admitted after this
  for (const Accepted& accepted : accepted_.snapshot()) accepted.connection->cancel();
  // The handlers use `this` until ConnectionInvalid, their last event.
  for (const Accepted& accepted : accepted_.snapshot()) accepted.events->waitForKind(Event::Kind::ConnectionInvalid);
}

tn::Value Server::echo(const Message& request) { return tn::Value(tn::Dictionary{{"echo", request.body}}); }

std::shared_ptr<Connection> Server::connection(std::size_t index) {
  const auto all = accepted_.waitFor(index + 1);
  return all.size() > index ? all[index].connection : nullptr;
}

EventRecorder& Server::events(std::size_t index) {
  static EventRecorder none;
  const auto all = accepted_.waitFor(index + 1);
  return all.size() > index ? *all[index].events : none;
}

Client::Client(const std::string& serviceName) {
  auto made = Connection::connectToService(serviceName, tn::dispatch::SerialQueue::create("test.client"));
  if (!made.ok()) {
    ADD_FAILURE() << made.error().description();
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
  struct Wait {  // shared with the handler, which may come after a timeout
    std::optional<Reply> reply;
    tn::dispatch::Semaphore done;
  };
  const auto wait = std::make_shared<Wait>();
  connection->sendWithReply(std::move(body), tn::dispatch::SerialQueue::create("test.reply"), [wait](Reply reply) {
    wait->reply = std::move(reply);
    wait->done.signal();
  });
  if (wait->done.waitFor(kPatience)) return *wait->reply;
  ADD_FAILURE() << "no reply";
  return tn::Error("test", 1, "no reply");
}

tn::Bytes rawFrameWithBody(uint64_t id, uint64_t replyTo, const tn::Bytes& body) {
  tn::Bytes frame(kFrameHeaderSize);
  storeBigEndian32(frame.data(), static_cast<uint32_t>(kFrameIdsSize + body.size()));
  storeBigEndian64(frame.data() + 4, id);
  storeBigEndian64(frame.data() + 12, replyTo);
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

tn::Bytes rawFrame(uint64_t id, uint64_t replyTo, const tn::Value& body) {
  return rawFrameWithBody(id, replyTo, tn::encodeCbor(body));
}

tn::Bytes nestedBody(int depth) {
  tn::Bytes body;
  for (int i = 1; i < depth; ++i) body.insert(body.end(), {0xa1, 0x61, 'k'});
  body.push_back(0xa0);
  return body;
}

tn::Value numbered(uint64_t n) { return tn::Value(tn::Dictionary{{"n", n}}); }

RawClient::RawClient(const std::string& socketPath) : fd_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  socketPath.copy(address.sun_path, sizeof address.sun_path - 1);
  if (::connect(fd_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) fd_.reset();
}

void RawClient::write(const tn::Bytes& bytes) {
  for (std::size_t written = 0; written < bytes.size();) {
    const ssize_t n = ::send(fd_.get(), bytes.data() + written, bytes.size() - written, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // the peer is gone; tests look at that separately
    written += static_cast<std::size_t>(n);
  }
}

bool RawClient::readExactly(uint8_t* out, std::size_t size) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  for (std::size_t got = 0; got < size;) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    pollfd entry{fd_.get(), POLLIN, 0};
    if (::poll(&entry, 1, 100) <= 0) continue;
    const ssize_t n = ::recv(fd_.get(), out + got, size - got, 0);
    if (n <= 0 && !(n < 0 && errno == EINTR)) return false;
    if (n > 0) got += static_cast<std::size_t>(n);
  }
  return true;
}

std::optional<RawFrame> RawClient::readFrame() {
  uint8_t header[kFrameHeaderSize];
  if (!readExactly(header, sizeof header)) return std::nullopt;
  RawFrame frame{loadBigEndian64(header + 4), loadBigEndian64(header + 12),
                 tn::Bytes(loadBigEndian32(header) - kFrameIdsSize), {}};
  if (!readExactly(frame.body.data(), frame.body.size())) return std::nullopt;
  return frame;
}

bool RawClient::waitForClose() {
  uint8_t buffer[4096];
  return eventually([&] {
    pollfd entry{fd_.get(), POLLIN, 0};
    if (::poll(&entry, 1, 10) <= 0) return false;
    const ssize_t n = ::recv(fd_.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    return n == 0 || (n < 0 && errno != EINTR && errno != EAGAIN);
  });
}

std::string pathOf(const std::string& serviceName) { return servicePath(serviceName).value(); }

}  // namespace relay::test
