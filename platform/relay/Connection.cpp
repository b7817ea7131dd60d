#include "platform/relay/Connection.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/relay/Channel.h"
#include "platform/relay/Frame.h"
#include "platform/relay/FrameReader.h"
#include "platform/relay/RelayError.h"
#include "platform/relay/ServicePath.h"

namespace relay {
namespace {

using detail::Channel;
using detail::CloseCause;

struct OpenedSocket {
  UniqueFd socket;
  PeerIdentity identity;
};

tn::Result<UniqueFd> connectSocket(const std::string& path) {
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket.valid()) return makeSystemError("socket", errno);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());  // length checked by servicePath
  // Connecting to a Unix socket completes at once or fails; it never blocks.
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    const int error = errno;
    if (error == ENOENT || error == ECONNREFUSED || error == EAGAIN || error == EINPROGRESS) {
      return makeRelayError(RelayErrorCode::ServiceUnavailable,
                            fmt::format("no listener accepts connections on {}: {}", path,
                                        makeSystemError("connect", error).message().value_or("")));
    }
    return makeSystemError(fmt::format("connect {}", path), error);
  }
  return socket;
}

tn::Result<OpenedSocket> openServiceSocket(std::string_view serviceName) {
  tn::Result<std::string> path = servicePath(serviceName);
  if (!path.ok()) return path.error();
  tn::Result<UniqueFd> socket = connectSocket(*path);
  if (!socket.ok()) return socket.error();
  tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(socket->get());
  if (!identity.ok()) return identity.error();
  return OpenedSocket{std::move(*socket), std::move(*identity)};
}

tn::Result<void> checkOutgoingDescriptors(const Descriptors& descriptors) {
  if (descriptors.size() > kMaxDescriptorsPerFrame) {
    return makeRelayError(RelayErrorCode::BadDescriptors,
                          fmt::format("{} descriptors exceed the limit of {} per frame", descriptors.size(),
                                      kMaxDescriptorsPerFrame));
  }
  for (const UniqueFd& fd : descriptors) {
    if (!fd.valid()) return makeRelayError(RelayErrorCode::BadDescriptors, "an invalid descriptor cannot be sent");
  }
  return {};
}

Event makeEvent(Event::Kind kind, std::string reason) {
  Event event;
  event.kind = kind;
  event.reason = std::move(reason);
  return event;
}

}  // namespace

tn::Result<std::shared_ptr<Connection>> Connection::connectToService(
    std::string serviceName, std::shared_ptr<tn::dispatch::SerialQueue> eventQueue) {
  tn::Result<OpenedSocket> opened = openServiceSocket(serviceName);
  if (!opened.ok()) return opened.error();
  auto connection = std::make_shared<Connection>(CreateTag{}, Role::Client, std::move(serviceName),
                                                 std::move(eventQueue), std::move(opened.value().identity));
  connection->channel_ = connection->makeChannel(std::move(opened.value().socket), nullptr,
                                                 detail::InboundLimits{}.messages, kMaxDescriptorsPerFrame);
  return connection;
}

std::shared_ptr<Connection> Connection::accepted(UniqueFd socket, PeerIdentity identity, std::string serviceName,
                                                 std::shared_ptr<void> lease, std::size_t maxOutstandingRequests,
                                                 std::size_t descriptorsPerRequest) {
  auto eventQueue = tn::dispatch::SerialQueue::create(
      fmt::format("relay.{}.{}", serviceName, identity.auditToken.pid));
  auto connection = std::make_shared<Connection>(CreateTag{}, Role::Server, std::move(serviceName),
                                                 std::move(eventQueue), std::move(identity));
  connection->channel_ = connection->makeChannel(std::move(socket), std::move(lease), maxOutstandingRequests,
                                                 descriptorsPerRequest);
  return connection;
}

Connection::Connection(CreateTag, Role role, std::string serviceName,
                       std::shared_ptr<tn::dispatch::SerialQueue> eventQueue, PeerIdentity identity)
    : role_(role),
      serviceName_(std::move(serviceName)),
      eventQueue_(std::move(eventQueue)),
      identity_(std::move(identity)) {}

Connection::~Connection() {
  if (channel_) channel_->close(CloseCause::Cancelled, "the connection was released");
  if (finalizer_ || context_) {
    eventQueue_->async([finalizer = std::move(finalizer_), context = std::move(context_)]() mutable {
      if (finalizer) finalizer(context);
      context.reset();
    });
  }
}

std::shared_ptr<Channel> Connection::makeChannel(UniqueFd socket, std::shared_ptr<void> lease,
                                                std::size_t maxInboundMessages, std::size_t descriptorsPerFrame) {
  Channel::Callbacks callbacks;
  const std::weak_ptr<Connection> weak = weak_from_this();
  callbacks.request = [weak](const std::shared_ptr<Channel>& channel, RawFrame frame) {
    if (const auto self = weak.lock()) {
      self->channelRequest(channel, frame.id, std::move(frame.body), std::move(frame.descriptors));
    } else {
      channel->handled(frame.body.size() + kFrameIdsSize);
    }
  };
  callbacks.closed = [weak](const std::shared_ptr<Channel>& channel, CloseCause cause,
                            const std::string& reason) -> tn::Error {
    if (const auto self = weak.lock()) return self->channelClosed(channel, cause, reason);
    return makeRelayError(RelayErrorCode::ConnectionInvalid, reason);
  };
  detail::InboundLimits limits;
  limits.messages = maxInboundMessages;
  limits.descriptorsPerFrame = descriptorsPerFrame;
  return Channel::create(std::move(socket), std::move(callbacks), std::move(lease), limits);
}

void Connection::setEventHandler(EventHandler handler) { eventHandler_ = std::move(handler); }

void Connection::resume() {
  std::shared_ptr<Channel> channel;
  {
    const std::lock_guard lock(mutex_);
    if (resumed_) return;
    resumed_ = true;
    self_ = shared_from_this();
    for (Event& event : held_) {
      eventQueue_->async([self = self_, event = std::move(event)] { self->handleEvent(event); });
    }
    held_.clear();
    channel = channel_;
  }
  if (channel) channel->start();
}

void Connection::cancel() {
  std::shared_ptr<Channel> channel;
  {
    const std::lock_guard lock(mutex_);
    if (cancelled_) return;
    cancelled_ = true;
    channel = channel_;
    if (!channel) markInvalidLocked("the connection was cancelled");
  }
  if (channel) channel->close(CloseCause::Cancelled, "the connection was cancelled");
}

bool Connection::send(tn::Value body) { return send(std::move(body), Descriptors()); }

bool Connection::send(tn::Value body, Descriptors descriptors) {
  tn::Result<tn::Bytes> frame = encodeFrame(body, 0);
  if (frame.ok()) {
    if (tn::Result<void> checked = checkOutgoingDescriptors(descriptors); !checked.ok()) frame = checked.error();
  }
  if (!frame.ok()) {
    TN_LOG_ERROR(tn::log::traffic(), "{}: message not sent: {}", description(), frame.error().description());
    return false;
  }
  tn::Error error;
  const std::shared_ptr<Channel> channel = channelForSending(error);
  return channel && channel->send(std::move(*frame), nullptr, nullptr, std::move(descriptors));
}

void Connection::sendWithReply(tn::Value body, std::shared_ptr<tn::dispatch::SerialQueue> replyQueue,
                               ReplyHandler handler) {
  sendWithReply(std::move(body), Descriptors(), std::move(replyQueue),
                [handler = std::move(handler)](Reply reply, Descriptors) { handler(std::move(reply)); });
}

void Connection::sendWithReply(tn::Value body, Descriptors descriptors,
                               std::shared_ptr<tn::dispatch::SerialQueue> replyQueue,
                               DescriptorReplyHandler handler) {
  const auto fail = [&](tn::Error error) {
    replyQueue->async([handler = std::move(handler), error = std::move(error)] { handler(error, {}); });
  };
  tn::Result<tn::Bytes> frame = encodeFrame(body, 0);
  if (!frame.ok()) return fail(frame.error());
  if (tn::Result<void> checked = checkOutgoingDescriptors(descriptors); !checked.ok()) return fail(checked.error());
  tn::Error error;
  const std::shared_ptr<Channel> channel = channelForSending(error);
  if (!channel) return fail(std::move(error));
  detail::PendingReply pending{replyQueue, std::move(handler)};
  if (channel->send(std::move(*frame), &pending, nullptr, std::move(descriptors))) return;
  handler = std::move(pending.handler);
  const std::lock_guard lock(mutex_);
  fail(unusableErrorLocked());
}

bool Connection::sendReply(const Message& request, tn::Value reply) {
  tn::Result<void> sent = trySendReply(request, std::move(reply));
  if (!sent && !isRelayError(sent.error(), RelayErrorCode::ConnectionInvalid)) {
    TN_LOG_ERROR(tn::log::traffic(), "{}: reply to {} not sent: {}", description(), request.id,
                 sent.error().description());
  }
  return sent.ok();
}

tn::Result<void> Connection::trySendReply(const Message& request, tn::Value reply) {
  return trySendReply(request, std::move(reply), Descriptors());
}

tn::Result<void> Connection::trySendReply(const Message& request, tn::Value reply, Descriptors descriptors) {
  if (tn::Result<void> checked = checkOutgoingDescriptors(descriptors); !checked.ok()) return checked.error();
  const std::shared_ptr<Channel> channel = request.channel.lock();
  {
    const std::lock_guard lock(mutex_);
    if (!channel || channel != channel_ || request.id == 0) {
      return makeRelayError(RelayErrorCode::ConnectionInvalid, "the request's connection is gone");
    }
  }
  tn::Result<tn::Bytes> frame = encodeFrame(reply, request.id);
  if (!frame.ok()) return frame.error();
  // The request keeps its share of the budget until its reply has left: a
  // peer that does not read its replies stops being read itself.
  if (!channel->send(std::move(*frame), nullptr, request.charge, std::move(descriptors))) {
    return makeRelayError(RelayErrorCode::ConnectionInvalid, "the connection closed");
  }
  return {};
}

std::shared_ptr<Channel> Connection::channelForSending(tn::Error& error) {
  {
    const std::lock_guard lock(mutex_);
    if (channel_) return channel_;
    if (role_ == Role::Server || cancelled_ || invalid_) {
      error = unusableErrorLocked();
      return nullptr;
    }
  }
  return reconnect(error);
}

std::shared_ptr<Channel> Connection::reconnect(tn::Error& error) {
  const std::lock_guard reconnecting(reconnectMutex_);
  {
    const std::lock_guard lock(mutex_);
    if (channel_) return channel_;  // another thread reconnected meanwhile
  }
  tn::Result<OpenedSocket> opened = openServiceSocket(serviceName_);
  if (!opened.ok()) {
    error = makeRelayError(RelayErrorCode::ConnectionInterrupted,
                           opened.error().message().value_or(opened.error().description()));
    return nullptr;
  }
  std::shared_ptr<Channel> channel =
      makeChannel(std::move(opened.value().socket), nullptr, detail::InboundLimits{}.messages,
                  kMaxDescriptorsPerFrame);
  bool installed = false;
  bool start = false;
  {
    const std::lock_guard lock(mutex_);
    if (cancelled_ || invalid_) {
      error = unusableErrorLocked();
    } else {
      channel_ = channel;
      identity_ = std::move(opened.value().identity);
      installed = true;
      start = resumed_;
    }
  }
  if (!installed) {
    channel->close(CloseCause::Cancelled, "the connection was cancelled while it reconnected");
    return nullptr;
  }
  if (start) channel->start();
  TN_LOG_DEBUG(tn::log::traffic(), "{}: reconnected", description());
  return channel;
}

void Connection::channelRequest(const std::shared_ptr<Channel>& channel, uint64_t id, tn::Bytes body,
                                Descriptors descriptors) {
  std::shared_ptr<Descriptors> shared;
  if (!descriptors.empty()) shared = std::make_shared<Descriptors>(std::move(descriptors));
  const std::lock_guard lock(mutex_);
  // Reading starts with resume(), so requests never have to be held.
  eventQueue_->async([self = shared_from_this(), channel, id, body = std::move(body), shared] {
    self->handleRequest(channel, id, body, shared);
  });
}

tn::Error Connection::channelClosed(const std::shared_ptr<Channel>& channel, CloseCause cause,
                                    const std::string& reason) {
  const std::lock_guard lock(mutex_);
  if (channel_ == channel) channel_.reset();
  if (cause == CloseCause::ProtocolViolation || cause == CloseCause::OutgoingOverflow) {
    TN_LOG_ERROR(tn::log::traffic(), "<relay connection pid={} service={}> ended: {}",
                 identity_.auditToken.pid, serviceName_, reason);
  }
  if (role_ == Role::Client && cause == CloseCause::PeerClosed && !cancelled_ && !invalid_) {
    deliverEventLocked(makeEvent(Event::Kind::ConnectionInterrupted, reason));
    return makeRelayError(RelayErrorCode::ConnectionInterrupted, reason);
  }
  markInvalidLocked(reason);
  return makeRelayError(RelayErrorCode::ConnectionInvalid, reason);
}

void Connection::deliverEventLocked(Event event) {
  if (!resumed_) {
    held_.push_back(std::move(event));
    return;
  }
  eventQueue_->async([self = shared_from_this(), event = std::move(event)] { self->handleEvent(event); });
}

void Connection::markInvalidLocked(std::string reason) {
  if (invalid_) return;
  invalid_ = true;
  deliverEventLocked(makeEvent(Event::Kind::ConnectionInvalid, std::move(reason)));
}

tn::Error Connection::unusableErrorLocked() const {
  if (role_ == Role::Client && !cancelled_ && !invalid_) {
    return makeRelayError(RelayErrorCode::ConnectionInterrupted, "the service is not reachable");
  }
  return makeRelayError(RelayErrorCode::ConnectionInvalid, "the connection is invalid");
}

void Connection::deliverTerminationImminent() {
  const std::lock_guard lock(mutex_);
  if (terminationDelivered_ || invalid_) return;
  terminationDelivered_ = true;
  deliverEventLocked(makeEvent(Event::Kind::TerminationImminent, "the process is about to exit"));
}

void Connection::handleRequest(const std::shared_ptr<Channel>& channel, uint64_t id, const tn::Bytes& body,
                               const std::shared_ptr<Descriptors>& descriptors) {
  // The request holds its share of the budget until its last copy is gone:
  // an owner that keeps it until it has answered limits what a peer can
  // have outstanding (Message::charge).
  const std::size_t length = body.size() + kFrameIdsSize;
  std::shared_ptr<const void> charge(nullptr, [channel, length](const void*) { channel->handled(length); });
  if (stopDelivering_) return;
  tn::Result<tn::Value> decoded = decodeFrameBody(body);
  if (!decoded.ok()) {
    // Nothing the peer sent after a malformed frame is delivered.
    stopDelivering_ = true;
    channel->close(CloseCause::ProtocolViolation, decoded.error().message().value_or(""));
  } else if (eventHandler_) {
    Event event;
    event.kind = Event::Kind::Message;
    event.message = Message{id, std::move(*decoded), channel, std::move(charge), descriptors};
    eventHandler_(event);
  }
}

void Connection::handleEvent(const Event& event) {
  if (eventHandler_) eventHandler_(event);
  if (event.kind != Event::Kind::ConnectionInvalid) return;
  eventHandler_ = nullptr;
  std::shared_ptr<Connection> self;
  const std::lock_guard lock(mutex_);
  self = std::move(self_);  // released after the lock; the caller still holds one
}

AuditToken Connection::auditToken() const {
  const std::lock_guard lock(mutex_);
  return identity_.auditToken;
}

pid_t Connection::pid() const {
  const std::lock_guard lock(mutex_);
  return identity_.auditToken.pid;
}

std::string Connection::executablePath() const {
  const std::lock_guard lock(mutex_);
  return identity_.executablePath;
}

PeerIdentity Connection::peerIdentity() const {
  const std::lock_guard lock(mutex_);
  return identity_;
}

std::string Connection::description() const {
  return fmt::format("<relay connection pid={} service={}>", pid(), serviceName_);
}

void Connection::setContext(std::shared_ptr<void> context) {
  const std::lock_guard lock(mutex_);
  context_ = std::move(context);
}

std::shared_ptr<void> Connection::context() const {
  const std::lock_guard lock(mutex_);
  return context_;
}

void Connection::setFinalizer(Finalizer finalizer) {
  const std::lock_guard lock(mutex_);
  finalizer_ = std::move(finalizer);
}

std::size_t Connection::pendingReplyCount() const {
  std::shared_ptr<Channel> channel;
  {
    const std::lock_guard lock(mutex_);
    channel = channel_;
  }
  return channel ? channel->pendingReplyCount() : 0;
}

}  // namespace relay
