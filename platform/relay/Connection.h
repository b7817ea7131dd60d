// Connection: one conversation with a peer process over the relay.
//
// Made by a Listener for each client that connects (a server connection),
// or by connectToService() in a client (a client connection). Either way:
//
//   auto connection = ...;
//   connection->setEventHandler([](const relay::Event& event) { ... });
//   connection->resume();                       // events start flowing
//   connection->sendWithReply(request, queue, [](relay::Reply reply) { ... });
//
// Events (Event.h) run on the connection's own serial event queue, one at a
// time, in order: requests in the order the peer sent them; then
// ConnectionInvalid, exactly once and last. Nothing is delivered before
// resume(); what happens earlier (a cancel, say) waits for it.
//
// Ending:
//   - A server connection becomes invalid when the peer goes away, when it
//     breaks a frame rule, when it leaves more than 64 MiB unread, or on
//     cancel().
//   - A client connection whose service goes away (the daemon exits or
//     restarts) gets ConnectionInterrupted instead and stays usable: the
//     next send connects to the service's socket again, with a new peer
//     identity. It becomes invalid only by cancel() or a frame violation.
//   Pending reply handlers receive the matching error (ConnectionInvalid or
//   ConnectionInterrupted) exactly once, on their queues.
//
// Lifetime: a resumed connection keeps itself alive until its
// ConnectionInvalid event has been handled; after that it drops its event
// handler (so a handler that captures the connection's owner does not keep
// it alive). A connection that was never resumed closes when its last
// reference goes. The context slot lets the daemon's per-client object be
// owned by the connection: it is released, after the finalizer ran, on the
// event queue when the connection is freed. A context that holds a strong
// reference to its connection keeps both alive forever; hold a weak one.
//
// Threads: every member function may be called from any thread, except as
// noted. Sends never block: frames the kernel does not take at once are
// queued for the I/O thread.

#pragma once

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Event.h"
#include "platform/relay/PeerIdentity.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace relay {

namespace detail {
class Channel;
enum class CloseCause;
}  // namespace detail

class Listener;

class Connection : public std::enable_shared_from_this<Connection> {
 public:
  using EventHandler = std::function<void(const Event&)>;
  using Finalizer = std::function<void(const std::shared_ptr<void>& context)>;

  // Connects to the listener of `serviceName` ($TENON_ROOT/run/tenon/relay/
  // <serviceName>). Events go to `eventQueue`. Errors: InvalidServiceName;
  // ServiceUnavailable when nothing accepts connections there (no socket,
  // or a listener not yet resumed); PeerUnidentified; SystemError.
  static tn::Result<std::shared_ptr<Connection>> connectToService(
      std::string serviceName, std::shared_ptr<tn::dispatch::SerialQueue> eventQueue);

  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Must be called before resume(). The handler runs on eventQueue().
  void setEventHandler(EventHandler handler);

  // Starts delivering events (and reading). Later calls do nothing.
  void resume();

  // Ends the connection: frames already sent still go out as far as the
  // kernel takes them, then the socket closes and ConnectionInvalid follows.
  void cancel();

  // Sends a one-way request. Returns false when nothing was sent: the
  // connection is invalid (or interrupted and the service cannot be
  // reached), or the body is not a dictionary or too large for a frame.
  // The peer must not reply to it (a reply to a request that awaits none
  // ends the connection).
  bool send(tn::Value body);
  // The same, passing `descriptors` with the frame (Descriptors.h); false
  // also for more than kMaxDescriptorsPerFrame or an invalid one. The
  // connection owns them from here on and closes its copies once sent.
  bool send(tn::Value body, Descriptors descriptors);

  // Sends a request and runs `handler` on `replyQueue` with its reply, or
  // with the error that kept it from coming. The handler runs exactly once,
  // never on the calling thread.
  void sendWithReply(tn::Value body, std::shared_ptr<tn::dispatch::SerialQueue> replyQueue,
                     ReplyHandler handler);
  // The same, passing `descriptors` with the request, and handing the
  // handler the descriptors the reply brought. A plain ReplyHandler's
  // request may also be answered with descriptors: they are closed.
  // BadDescriptors for more than kMaxDescriptorsPerFrame or an invalid one.
  void sendWithReply(tn::Value body, Descriptors descriptors,
                     std::shared_ptr<tn::dispatch::SerialQueue> replyQueue, DescriptorReplyHandler handler);

  // Answers `request`, a message this connection delivered. Returns false
  // when nothing was sent: the connection (or, for a client connection, the
  // socket the request came on) is gone, or `reply` is not a dictionary or
  // too large. Answer each request at most once: a second reply to the same
  // id ends the connection at the peer.
  bool sendReply(const Message& request, tn::Value reply);

  // sendReply, telling why nothing was sent: ConnectionInvalid (the
  // connection or its socket is gone), MessageTooLarge (the reply does not
  // fit in a frame: the caller may still answer with something smaller) or
  // NotAMessage.
  tn::Result<void> trySendReply(const Message& request, tn::Value reply);
  // trySendReply, passing `descriptors` with the reply; BadDescriptors as
  // for send(). They are closed when nothing was sent.
  tn::Result<void> trySendReply(const Message& request, tn::Value reply, Descriptors descriptors);

  // The peer's identity (for a client connection: the service's, as of the
  // latest connect).
  AuditToken auditToken() const;
  pid_t pid() const;
  std::string executablePath() const;
  // All of it: token, executable file, seccomp filter count.
  PeerIdentity peerIdentity() const;

  const std::string& serviceName() const { return serviceName_; }
  bool isServerSide() const { return role_ == Role::Server; }
  const std::shared_ptr<tn::dispatch::SerialQueue>& eventQueue() const { return eventQueue_; }

  // "<relay connection pid=123 service=S>".
  std::string description() const;

  // The context slot (see above). Any thread.
  void setContext(std::shared_ptr<void> context);
  std::shared_ptr<void> context() const;
  void setFinalizer(Finalizer finalizer);

  // Requests sent on the current socket that still wait for their reply.
  std::size_t pendingReplyCount() const;

 private:
  friend class Listener;
  friend void announceTerminationTo(Connection& connection);
  enum class Role { Server, Client };
  struct CreateTag {};

 public:
  Connection(CreateTag, Role role, std::string serviceName,
             std::shared_ptr<tn::dispatch::SerialQueue> eventQueue, PeerIdentity identity);

 private:
  // A server connection on an accepted socket; `lease` goes with the socket.
  // At most `maxOutstandingRequests` of its requests are delivered and not
  // yet handled (Message::charge) at any time.
  // Its requests may bring up to `descriptorsPerRequest` descriptors.
  static std::shared_ptr<Connection> accepted(UniqueFd socket, PeerIdentity identity, std::string serviceName,
                                              std::shared_ptr<void> lease, std::size_t maxOutstandingRequests,
                                              std::size_t descriptorsPerRequest);

  std::shared_ptr<detail::Channel> makeChannel(UniqueFd socket, std::shared_ptr<void> lease,
                                               std::size_t maxInboundMessages, std::size_t descriptorsPerFrame);
  // The socket to send on; a client connection that was interrupted
  // connects again. Null when there is none; then `error` says why.
  std::shared_ptr<detail::Channel> channelForSending(tn::Error& error);
  std::shared_ptr<detail::Channel> reconnect(tn::Error& error);

  // I/O thread, from the channel.
  void channelRequest(const std::shared_ptr<detail::Channel>& channel, uint64_t id, tn::Bytes body,
                      Descriptors descriptors);
  tn::Error channelClosed(const std::shared_ptr<detail::Channel>& channel, detail::CloseCause cause,
                          const std::string& reason);

  // Posts the event to the event queue, or keeps it for resume(). Needs mutex_.
  void deliverEventLocked(Event event);
  void markInvalidLocked(std::string reason);
  tn::Error unusableErrorLocked() const;
  void deliverTerminationImminent();

  // Event queue.
  void handleRequest(const std::shared_ptr<detail::Channel>& channel, uint64_t id, const tn::Bytes& body,
                     const std::shared_ptr<Descriptors>& descriptors);
  void handleEvent(const Event& event);

  const Role role_;
  const std::string serviceName_;
  const std::shared_ptr<tn::dispatch::SerialQueue> eventQueue_;

  EventHandler eventHandler_;  // set before resume(); then event queue only
  bool stopDelivering_ = false;  // event queue only: a request body was malformed

  std::mutex reconnectMutex_;  // one reconnect at a time; taken before mutex_
  mutable std::mutex mutex_;
  std::shared_ptr<detail::Channel> channel_;  // guarded; null when interrupted or over
  PeerIdentity identity_;                     // guarded
  bool resumed_ = false;                      // guarded
  bool cancelled_ = false;                    // guarded
  bool invalid_ = false;                      // guarded: ConnectionInvalid was delivered (or held)
  bool terminationDelivered_ = false;         // guarded
  std::vector<Event> held_;                   // guarded: events waiting for resume()
  std::shared_ptr<Connection> self_;          // guarded: resumed and not yet invalid
  std::shared_ptr<void> context_;             // guarded
  Finalizer finalizer_;                       // guarded
};

}  // namespace relay
