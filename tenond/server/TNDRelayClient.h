#pragma once

// One TNDRelayClient per accepted connection: who the peer is (pid,
// executable path, the bundle its executable lives in, its entitlements),
// and the turning of each request message into a Transaction handed to the
// service queue. The connection owns the client; the client refers to its
// connection weakly and to the server strongly.

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "libtenon/model/TNBundle.h"
#include "platform/codesign/Codesign.h"
#include "platform/relay/Connection.h"
#include "platform/value/Value.h"

namespace tnd {

class TNDServer;

class TNDRelayClient : public std::enable_shared_from_this<TNDRelayClient> {
 public:
  // Sets the client up for a new connection and resumes the connection,
  // which owns the result from then on.
  static std::shared_ptr<TNDRelayClient> initWithConnection(std::shared_ptr<relay::Connection> connection,
                                                            std::shared_ptr<TNDServer> server);

  // The peer's process id.
  int32_t pid() const;

  // The entitlement's value, or null when the peer has none of that name.
  tn::Value entitlementValueForKey(const std::string& key) const;
  // True when the entitlement is present and not equal to false (0 counts
  // as false; a string, an array or true count as true).
  bool hasEntitlement(const std::string& key) const;
  // True when the peer runs under seccomp filters beyond the daemon's own.
  bool isSandboxed() const;

  void dying();
  void dead();

  // "<TNDRelayClient 0x... con=... pid=N path=...>", or the "NO CONNECTION"
  // form once the connection is gone.
  std::string description() const;

  bool acceptWork() const { return acceptWork_; }
  void setAcceptWork(bool accept) { acceptWork_ = accept; }
  // Only touched by units of work on the service queue.
  uint32_t requestCount() const { return requestCount_; }
  void setRequestCount(uint32_t count) { requestCount_ = count; }

  std::shared_ptr<relay::Connection> connection() const { return connection_.lock(); }
  const std::shared_ptr<TNDServer>& server() const { return server_; }
  const std::string& path() const { return path_; }
  const std::shared_ptr<tn::TNBundle>& bundle() const { return bundle_; }

 private:
  TNDRelayClient(std::shared_ptr<relay::Connection> connection, std::shared_ptr<TNDServer> server);
  void handleEvent(const relay::Event& event);
  void handleRequest(const relay::Message& message);

  std::atomic<bool> acceptWork_{true};
  uint32_t requestCount_ = 0;
  std::weak_ptr<relay::Connection> connection_;
  const std::shared_ptr<TNDServer> server_;
  std::string path_;
  std::shared_ptr<tn::TNBundle> bundle_;
  std::optional<codesign::TaskHandle> task_;
  int32_t pid_ = 0;  // kept for the log lines after the connection is gone
};

}  // namespace tnd
