#pragma once

// One TNDRelayClient per accepted connection: who the peer is (pid,
// credentials, executable path, the bundle its executable lives in, its
// entitlements), and the turning of each request message into a Transaction
// handed to the service queue. The connection owns the client; the client
// refers to its connection weakly and to the server strongly.
//
// Identity: the relay identified the peer at accept time (PeerIdentity:
// credentials, groups, the file it runs, its seccomp filter count). The
// entitlements and the bundle are then read on the connection's own event
// queue, before the connection is resumed: they come from files, some of
// which the peer may control, so no other client waits for them, and no
// request of this connection is handled before they are known. Until then
// the client has no entitlements.
//
// Every question fails closed: a peer whose executable could not be opened
// has no entitlements; one that runs another file than when it connected
// (it called exec) has none from the moment that is seen; one whose seccomp
// status could not be read is sandboxed.

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "libtenon/model/TNBundle.h"
#include "platform/codesign/Codesign.h"
#include "platform/relay/Connection.h"
#include "platform/value/Value.h"
#include "tenond/plugin/TNDHost.h"

namespace tnd {

class TNDServer;

// The entitlement that lets a program do what changes the registry for
// everyone (remove plug-ins, list every plug-in); see mayManage().
inline constexpr const char* kManagerEntitlement = "com.ostrel.private.tenon.manager";

class TNDRelayClient : public TNDHost, public std::enable_shared_from_this<TNDRelayClient> {
 public:
  // Sets the client up for a new connection and resumes the connection,
  // which owns the result from then on.
  static std::shared_ptr<TNDRelayClient> initWithConnection(std::shared_ptr<relay::Connection> connection,
                                                            std::shared_ptr<TNDServer> server);

  // The peer's process id.
  int32_t pid() const override;

  // The entitlement's value, or null when the peer has none of that name.
  // A value is only returned while the peer still runs the file it ran when
  // it connected (checked again on every call that would grant something:
  // the pid must still be the process that connected, and /proc/<pid>/exe
  // the same device and inode); once it is not, the peer has no
  // entitlements for the rest of the connection (logged once).
  tn::Value entitlementValueForKey(const std::string& key) const override;
  // True when the entitlement is present and not equal to false (0 counts
  // as false; a string, an array or true count as true).
  bool hasEntitlement(const std::string& key) const override;
  // True when the peer ran under seccomp filters beyond the daemon's own
  // when it connected, or when that could not be read.
  bool isSandboxed() const;
  // True when the peer's user may do privileged things: uid 0, the daemon's
  // own uid, or a member (primary or supplementary group, as of connect())
  // of a group the configuration names in "privileged-groups".
  bool isPrivilegedUser() const;
  // The one test for privileged requests: the program holds the manager
  // entitlement AND its user is privileged.
  bool mayManage() const;

  void dying();
  void dead();

  // "<TNDRelayClient 0x... con=... pid=N path=...>", or the "NO CONNECTION"
  // form once the connection is gone.
  std::string description() const;

  bool acceptWork() const { return acceptWork_; }
  void setAcceptWork(bool accept) { acceptWork_ = accept; }
  // Replies handed to the connection's queue and not yet written: while
  // there are any, later replies take the same way, so that replies leave
  // in the order of their requests (Transaction::done).
  std::atomic<uint32_t>& queuedReplies() { return queuedReplies_; }
  // Only touched by units of work on the service queue.
  uint32_t requestCount() const { return requestCount_; }
  void setRequestCount(uint32_t count) { requestCount_ = count; }

  std::shared_ptr<relay::Connection> connection() const { return connection_.lock(); }
  const std::shared_ptr<TNDServer>& server() const { return server_; }
  const std::string& path() const { return path_; }
  // None until the identity is complete, or when the executable is in no
  // bundle.
  std::shared_ptr<tn::TNBundle> bundle() const override;
  // TNDHost: the executable path read when the peer connected.
  std::string executablePath() const override { return path_; }
  const relay::PeerIdentity& peerIdentity() const { return peer_; }

 private:
  TNDRelayClient(std::shared_ptr<relay::Connection> connection, std::shared_ptr<TNDServer> server);
  // The connection's event queue, before resume().
  void establishIdentity();
  // False, from the first time it is seen on, when the peer no longer runs
  // the file it connected with.
  bool stillRunsItsExecutable() const;
  void handleEvent(const relay::Event& event);
  void handleRequest(const relay::Message& message);

  std::atomic<bool> acceptWork_{true};
  std::atomic<uint32_t> queuedReplies_{0};
  uint32_t requestCount_ = 0;
  std::weak_ptr<relay::Connection> connection_;
  const std::shared_ptr<TNDServer> server_;
  const relay::PeerIdentity peer_;  // as the relay captured it at accept time
  const std::string path_;
  mutable std::mutex identityMutex_;
  std::shared_ptr<tn::TNBundle> bundle_;      // guarded by identityMutex_
  std::optional<codesign::TaskHandle> task_;  // guarded by identityMutex_
  mutable std::atomic<bool> executableChanged_{false};
  int32_t pid_ = 0;  // kept for the log lines after the connection is gone
};

}  // namespace tnd
