#pragma once

// libtenon/client: TNDaemonClient, the client side of tenond's request
// protocol (library tn_client).
//
// A client object holds one relay connection to the daemon's service. Each
// operation builds one request dictionary (the envelope keys `request` and
// `version`, plus the keys of its request type), sends it and returns at
// once; the raw reply reaches the caller's reply block later, on the
// client's own serial reply queue ("tenond_client"):
//
//   tn::TNDaemonClient client;                        // "com.ostrel.tenon.tenond"
//   client.matchPlugIns(rules, 0, [&](relay::Reply reply) {
//     if (auto error = tn::TNDaemonClient::errorInReply(reply)) { ... }
//     tn::Value forms = client.convertFromRelay((*reply)["matches"]);
//   });
//
// The reply object is a relay::Reply: the reply dictionary exactly as the
// daemon sent it, or the relay error that kept it from coming (daemon not
// running, connection broken). errorInReply() turns both kinds of failure
// into one error of domain "Tenon". docs/protocol.md describes the requests
// and replies for implementers in other languages.
//
// Queues and threads: the operations may be called from any thread. Reply
// blocks and connection events run on replyQueue(), one at a time, so the
// reply blocks of one client never run concurrently with each other; a
// block must not throw (the queue aborts the process), with the deliberate
// exception described in InternalInconsistency.h.
//
// Lifetime: the connection is opened at construction and kept for the
// client's lifetime; the relay itself reconnects after the daemon restarts
// (ConnectionInterrupted). If the service cannot be reached at
// construction, each later send tries once more to connect, and a send
// that cannot reach the daemon hands its reply block the relay error. The
// destructor cancels the connection: replies still pending then reach their
// blocks as ConnectionInvalid. Blocks never refer to the client, so it may
// be destroyed while replies are pending.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Event.h"
#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/URL.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tn {

// Plug-ins named by bundle path and UUID, in the order they are to be sent.
// The pairs travel as the parallel `uuids` and `paths` arrays, so the daemon
// can fall back from an unknown UUID to its path.
using PlugInsByPath = std::vector<std::pair<std::string, UUID>>;

class TNDaemonClient {
 public:
  using ReplyBlock = relay::ReplyHandler;  // void(relay::Reply)

  static constexpr std::string_view kDefaultServiceName = "com.ostrel.tenon.tenond";
  static constexpr uint64_t kCurrentProtocolVersion = 3;
  static constexpr std::string_view kReplyQueueLabel = "tenond_client";

  // Creates the reply queue, connects to `serviceName` (none: the default
  // service) with events delivered on the reply queue, installs the event
  // handler and resumes the connection. Never fails; see Lifetime above.
  explicit TNDaemonClient(std::optional<std::string> serviceName = std::nullopt);
  ~TNDaemonClient();
  TNDaemonClient(const TNDaemonClient&) = delete;

  // Calls `lost` on the reply queue each time the connection breaks
  // (interrupted or invalid), but not for the client's own release. What
  // the daemon ties to a connection, holds above all, is gone then, even
  // when the relay reconnects by itself.
  void setConnectionLostHandler(std::function<void()> lost);
  TNDaemonClient& operator=(const TNDaemonClient&) = delete;

  // --- Properties ---

  // The connection to the daemon's service; null while it could not be made.
  std::shared_ptr<relay::Connection> tenond() const;
  const std::shared_ptr<dispatch::SerialQueue>& replyQueue() const { return replyQueue_; }
  const std::string& serviceName() const { return serviceName_; }
  // Sent with every request; 3 after construction. Not synchronised: set it
  // before sending from other threads.
  uint64_t protocolVersion() const { return protocolVersion_; }
  void setProtocolVersion(uint64_t version) { protocolVersion_ = version; }

  // --- Operations: one request each; `reply` runs once on replyQueue() ---

  // "add": registers the plug-in bundles at these absolute paths.
  void addPlugIns(const std::vector<std::string>& paths, ReplyBlock reply);
  // "remove": unregisters them (the daemon requires the manager entitlement).
  void removePlugIns(const std::vector<std::string>& paths, ReplyBlock reply);
  // "bulk": bulk options; the daemon supports none.
  void bulkPlugins(uint64_t flags, ReplyBlock reply);
  // "ready": makes the plug-ins launchable for this process. `environment`
  // is sent only when given, even when empty (sending it at all needs a host
  // entitlement at the daemon).
  void readyPlugIns(const PlugInsByPath& plugins, uint64_t flags, const std::optional<Dictionary>& environment,
                    ReplyBlock reply);
  // "access": read access to the plug-ins' bundles; the reply's `extensions`
  // holds one token per plug-in.
  void accessPlugIns(const PlugInsByPath& plugins, uint64_t flags, ReplyBlock reply);
  // "find" by UUID: `uuids` is the single UUID value, not an array.
  void findPlugInByUUID(const UUID& uuid, ReplyBlock reply);
  // "find" by URL: `paths` is the URL's absolute string, not an array.
  void findPlugInByPathURL(const URL& url, ReplyBlock reply);
  // "match": discovery with rules and discovery flags; the reply's `matches`
  // holds the forms in the typed encoding (convertFromRelay).
  void matchPlugIns(const Dictionary& rules, uint64_t flags, ReplyBlock reply);
  // "explain" (Tenon's own): why the plug-in named by `plugIn` (a UUID, or
  // the path of its bundle) is or is not offered to a host for these rules
  // and flags. The host is this process, or, for a manager, the program at
  // `hostExecutable`. The reply's `explanation` holds the steps.
  struct ExplainedPlugIn {
    std::optional<UUID> uuid;
    std::optional<std::string> path;
  };
  void explainPlugIn(const ExplainedPlugIn& plugIn, const Dictionary& rules, uint64_t flags,
                     const std::optional<std::string>& hostExecutable, ReplyBlock reply);
  // "annotate": applies one annotation change to the plug-ins.
  void setPluginAnnotations(const std::vector<UUID>& uuids, const Dictionary& annotations, ReplyBlock reply);
  // "bulk-annotate": UUID string to extension dictionary.
  void bulkSetPluginAnnotations(const Dictionary& annotations, ReplyBlock reply);
  // "lock", hold form: holds the plug-ins at these paths; the reply's `uuids`
  // is the hold's token.
  void holdPlugins(const std::vector<std::string>& paths, uint64_t flags, ReplyBlock reply);
  // "lock", release form: `uuids` is an array holding the one token.
  void releaseHold(const UUID& token, ReplyBlock reply);

  // --- Building blocks ---

  // A new request: `request` = type, `version` = protocolVersion().
  Dictionary request(std::string_view type) const;
  // request(type) plus `paths`, the array of strings.
  Dictionary request(std::string_view type, const std::vector<std::string>& paths) const;
  // Sets `uuids` and `paths` from one pass over `plugins`: equal length,
  // element i of both from pair i.
  static void set(Dictionary& request, const PlugInsByPath& plugins);
  // Sets `uuids` to the array of UUID values, in order (empty for none).
  static void set(Dictionary& request, const std::vector<UUID>& uuids);
  // Logs "request: …" (traffic, debug), sends the request, and hands the
  // reply, logged as "reply: …" (traffic, debug), to `reply` on replyQueue().
  void send(Dictionary request, ReplyBlock reply);

  // Sends and waits on the calling thread for the reply, at most `timeout`;
  // after that the result is a timeout error (BlockingReply.h). For tools and
  // tests. Must not be called on replyQueue() (that would wait on itself;
  // the process aborts instead).
  relay::Reply sendAndWait(Dictionary request, std::chrono::milliseconds timeout);

  // --- Replies ---

  // The failure a reply reports, or none for a success:
  //   a relay error              → Tenon error 4 with the relay error's description;
  //   no errorcode, no error     → none;
  //   error without errorcode    → throws InternalInconsistency (a daemon bug);
  //   errorcode without error    → Tenon error with that code and
  //                                "unknown error returned by Tenon subsystem";
  //   errorcode and error        → Tenon error with that code and message.
  static std::optional<Error> errorInReply(const relay::Reply& reply);

  // Decodes a value in the typed encoding (the `matches` of "find" and
  // "match") when protocolVersion() is 3; none (a null value) for any other
  // version, and when the value is not a valid typed encoding.
  Value convertFromRelay(const Value& message) const;

  // The typed encoding of `value` for protocol version 3; none (a null
  // value) for any other version. The daemon encodes plug-in forms with it.
  static Value convertToRelay(const Value& value, uint64_t version);

 private:
  // The connection, connecting first when there is none yet. Any thread.
  Result<std::shared_ptr<relay::Connection>> connection();
  Result<std::shared_ptr<relay::Connection>> connectLocked();
  struct ConnectionWatch;
  static relay::Connection::EventHandler eventHandler(std::shared_ptr<ConnectionWatch> watch);

  const std::string serviceName_;
  const std::shared_ptr<dispatch::SerialQueue> replyQueue_;
  uint64_t protocolVersion_ = kCurrentProtocolVersion;

  // What the connection's event handler shares with the client: whether
  // the client is cancelling its own connection (the event this causes is
  // no communications error) and who to tell of a broken connection.
  struct ConnectionWatch {
    std::atomic<bool> releasing{false};  // the client's own cancel: stay quiet
    std::mutex mutex;
    std::function<void()> lost;  // guarded by mutex
  };
  const std::shared_ptr<ConnectionWatch> watch_ = std::make_shared<ConnectionWatch>();

  mutable std::mutex mutex_;
  std::shared_ptr<relay::Connection> tenond_;  // guarded by mutex_
};

}  // namespace tn
