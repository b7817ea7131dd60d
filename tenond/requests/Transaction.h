#pragma once

// tenond/requests: one Transaction carries one request through the daemon,
// from its dispatch on the service queue to its one reply. Each request type
// has one operation, a method named after it.
//
// Contract with the operations: each sends exactly one reply, by done() or
// by fail(), which calls done(); after a fail() it stops. marshalPaths()
// sends its own failure replies; a per-path operation that answers false
// must have sent one itself.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/relay/Connection.h"
#include "platform/value/Error.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tnd {

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
};

inline constexpr uint64_t kCurrentProtocolVersion = 3;

class Transaction {
 public:
  // (path, resolved) → keep walking?
  using PathOperation = std::function<bool(const std::string& path, bool resolved)>;

  Transaction(relay::Message request, std::shared_ptr<TNDRelayClient> client);

  // Runs the request. On the service queue.
  void dispatch();

  // Sends the reply on the connection (nothing when it is gone).
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
  void unrecognized();

  // Lookup requests (LookupRequests.cpp).
  void findPlugIn();
  std::shared_ptr<TNDPlugIn> findPlugInByUUID(const tn::UUID& uuid);
  std::shared_ptr<TNDPlugIn> findPlugInByPathURL(const std::string& text);
  // Sets the form's "annotations": the stored annotation, else an empty one.
  void addAnnotationForPlugIn(const TNDPlugIn& plugIn, tn::Dictionary& form);
  // The policy hook for plug-ins without a stored annotation: no for all.
  static bool pluginShouldBeAutoEnabled(const TNDPlugIn& plugIn);

  // Registration requests (RegistrationRequests.cpp).
  void addPlugIns();
  void removePlugIns();
  void bulkPlugIns();

  const std::shared_ptr<TNDRelayClient> client_;
  const relay::Message request_;
  tn::Dictionary reply_;
  uint64_t version_ = 0;
};

}  // namespace tnd
