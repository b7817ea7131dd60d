#pragma once

// tenond/requests: one Transaction carries one request through the daemon,
// from its dispatch on the service queue to its one reply. Each request type
// has one operation, a method named after it.
//
// Contract with the operations: each sends exactly one reply, by done() or
// by fail(), which calls done(); after a fail() it stops. marshalPaths()
// and processUuidList() send their own failure replies; a per-path or
// per-plug-in operation that answers false must have sent one itself.

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/relay/Connection.h"
#include "platform/value/Error.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tnd {

class Discovery;
class TNDHost;
class TNDPlugIn;
class TNDRelayClient;
class TNDServer;

// Error codes of failure replies.
enum : uint64_t {
  kErrorRegistration = 2,
  kErrorInvalidRequest = 4,
  kErrorProtocolVersion = 7,
  kErrorBadPath = 9,
  kErrorNotPermitted = 11,
  kErrorBusy = 14,
  kErrorNotFound = 15,
  kErrorBadValue = 18,
  kErrorReplyTooLarge = 21,  // the reply would not fit in a frame
};

inline constexpr uint64_t kCurrentProtocolVersion = 3;

// Owned by a shared pointer: a request that answers later ("lock" with
// termination) keeps its transaction alive until it replies.
class Transaction : public std::enable_shared_from_this<Transaction> {
 public:
  // (path, resolved) → keep walking?
  using PathOperation = std::function<bool(const std::string& path, bool resolved)>;
  // (plug-in) → keep walking?
  using PlugInOperation = std::function<bool(const std::shared_ptr<TNDPlugIn>& plugIn)>;

  Transaction(relay::Message request, std::shared_ptr<TNDRelayClient> client);

  // Runs the request. On the service queue.
  void dispatch();

  // Sends the reply on the connection (nothing when it is gone): at once
  // when it is small and no earlier reply of the client is still queued,
  // otherwise encoded and written on the connection's own queue, after the
  // caller's work (replies leave in request order either way). A reply too
  // large for a frame is replaced by an error reply (21), so that
  // every request still gets exactly one answer. Gives the request's share
  // of the client's budget back once the reply has left. Annotation changes
  // the request made are written to the annotation file first
  // (storeAnnotation).
  void done();
  // Sets errorcode and error (when given) in the reply, then done().
  void fail(uint64_t code, const std::optional<std::string>& message);
  // A "Tenon" error keeps its code and message; any other domain gets
  // `defaultCode` and the error's localized description.
  void fail(uint64_t defaultCode, const tn::Error& error);

  // Walks the request's `paths` array, resolving each absolute path to its
  // canonical form, and hands each to `operation`. Fails the request itself
  // for a missing array (4), a non-string element (4) or a relative path (9).
  bool marshalPaths(const PathOperation& operation);
  // marshalPaths, then done() when the walk succeeded.
  bool processPaths(const PathOperation& operation);

  // Resolves the request's `uuids` array to plug-ins, in order, and hands
  // each to `operation`; a UUID the database does not know falls back to
  // element i of a `paths` array of the same length (a file-system path).
  // Fails the request itself (code 4) for a missing `uuids` array, an
  // element that is not a UUID, or a plug-in found neither way, and then
  // answers false; an operation that answers false stops the walk (it must
  // have replied). True when every element was handed over: the caller
  // replies. What earlier elements' operations did stays done.
  bool processUuidList(const PlugInOperation& operation);

  const std::shared_ptr<TNDRelayClient>& client() const { return client_; }
  const tn::Value& request() const { return request_.body; }
  tn::Dictionary& reply() { return reply_; }
  uint64_t version() const { return version_; }
  std::shared_ptr<TNDServer> server() const;
  std::shared_ptr<relay::Connection> connection() const;

 private:
  // The operations of the request types, in the order they are tested.
  struct Route {
    const char* type;
    void (Transaction::*operation)();
  };
  static const Route kRoutes[];

  void route(const std::string* type);
  // On the connection's queue: encodes and writes the reply.
  void sendReply(relay::Connection& connection, tn::Value reply);
  void sendReplyTooLarge(relay::Connection& connection, const tn::Error& error);
  void unrecognized();

  // Lookup requests (LookupRequests.cpp).
  void findPlugIn();
  std::shared_ptr<TNDPlugIn> findPlugInByUUID(const tn::UUID& uuid);
  std::shared_ptr<TNDPlugIn> findPlugInByPathURL(const std::string& text);
  // The walk's fallback for an unknown UUID: the plug-in at `path` (logged).
  std::shared_ptr<TNDPlugIn> findPlugInByFallbackPath(const tn::UUID& uuid, const tn::Value& path);
  // The "annotations" a form carries: the stored annotation, else an empty
  // one (or an election of 1 for a plug-in enabled automatically).
  tn::Dictionary annotationForForm(const TNDPlugIn& plugIn);
  // The policy hook for plug-ins without a stored annotation: no for all.
  static bool pluginShouldBeAutoEnabled(const TNDPlugIn& plugIn);

  // Discovery requests (DiscoveryRequests.cpp): "match", and "explain"
  // (why one plug-in is or is not offered to a host).
  struct DiscoveryInput {
    tn::Value rules;  // a dictionary, or null
    uint64_t flags = 0;
  };
  void matchPlugIns();
  void explainPlugIn();
  // The request's rules and flags, checked (bad rules: 4; TNDiscoverAll
  // from a client that may not: 11); none when the request failed.
  std::optional<DiscoveryInput> discoveryInput();
  Discovery makeDiscovery(const DiscoveryInput& input, std::shared_ptr<const TNDHost> host, bool log);
  // "explain"'s host (the client, or for a manager the executable named by
  // "host") and plug-in ("uuids" or "paths"); none when the request failed.
  std::shared_ptr<const TNDHost> explainedHost();
  std::shared_ptr<TNDPlugIn> explainedPlugIn();
  // Readiness requests (ReadinessRequests.cpp): "ready" makes plug-ins
  // launchable for the client; "access" gives a read-only file token per
  // plug-in bundle.
  void readyPlugIns();
  void accessPlugIns();
  // "ready"'s environment: none when the request failed (no entitlement);
  // else the dictionary given, or none when `environment` is absent or not
  // a dictionary.
  std::optional<std::optional<tn::Dictionary>> readyEnvironment();
  // Registers plug-ins with the process supervisor for this client
  // (TNDPlugIn::ExternalServiceRegistrar).
  std::function<int(const std::string& executablePath, const tn::Value& overlay)> registrarForClient() const;
  // Hold requests (HoldRequests.cpp): "lock".
  void lockDownPlugIns();
  // The plug-ins the hold form's `paths` name (applications' plug-ins, or
  // with TNHoldPlugInPaths the plug-ins themselves); none when the request
  // failed (9 for a path that does not resolve or holds no plug-in).
  std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> plugInsToHold(uint64_t flags);
  // With a busy plug-in among them: replies 14 with the busy reports in
  // `conflicts` and answers true.
  bool refuseWhenBusy(const std::vector<std::shared_ptr<TNDPlugIn>>& plugIns);
  // The users a hold or termination by this client reaches: every user
  // (none) for a privileged client, else the client's own.
  std::optional<uid_t> holdReach() const;
  // Annotation requests (AnnotationRequests.cpp).
  void annotatePlugIns();
  void bulkAnnotatePlugIns();
  // Stores an annotation change for the plug-in with its save deferred
  // until just before the reply (done()), so that a request writes the
  // annotation file once, yet every change it made is on disk when it
  // answers, failed or not.
  std::optional<tn::Error> storeAnnotation(const tn::Dictionary& change, const TNDPlugIn& plugIn);
  // Writes what storeAnnotation deferred; done() does it at the latest.
  void saveStoredAnnotations();

  // Registration requests (RegistrationRequests.cpp).
  void addPlugIns();
  void removePlugIns();
  void bulkPlugIns();

  const std::shared_ptr<TNDRelayClient> client_;
  relay::Message request_;  // its charge is given back by done()
  tn::Dictionary reply_;
  uint64_t version_ = 0;
  bool annotationsUnsaved_ = false;  // see storeAnnotation
};

}  // namespace tnd
