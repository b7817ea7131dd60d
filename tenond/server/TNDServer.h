#pragma once

// tenond/server: the one server object of the daemon, its client
// connections and its holds.
//
// TNDServer owns the listening endpoint of the named service, the queues on
// which all work runs, and the list of holds. It is also the plug-in
// database (it derives from TNDatabase) and that database's delegate.
//
// Queues: "relay" gets the listener's events; "service" (quality of service
// 25) runs every transaction of every client, one at a time, taking the
// clients with work in turn (a FairQueue: one transaction per client, round
// robin, each client's in the order it sent them); "serverSync" guards the
// hold list and is only entered synchronously. Lock order (QueueRanks.h):
// "service" may enter "serverSync"; code on "serverSync" enters no other
// queue.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "platform/dispatch/FairQueue.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Listener.h"
#include "platform/vigil/Vigil.h"
#include "platform/warden/Warden.h"
#include "platform/warden/WardenService.h"
#include "tenond/database/TNDUserPrefs.h"
#include "tenond/database/TNDatabase.h"
#include "tenond/server/TNDConfiguration.h"

namespace tnd {

class TNDPlugInHold;
class TNDRelayClient;

inline constexpr int kServiceQualityOfService = 25;  // user-initiated

class TNDServer final : public TNDatabase,
                        public TNDatabaseDelegate,
                        public std::enable_shared_from_this<TNDServer> {
 public:
  // Builds the server for `serviceName` with the annotation file at
  // `databasePath` (none: the default location) and stores it as the
  // process's server. The listener is bound but suspended: nothing is
  // accepted before run(). Returns none, having logged why, when the
  // database or the listener cannot be made.
  static std::shared_ptr<TNDServer> initForService(const std::string& serviceName,
                                                   const std::optional<std::string>& databasePath);

  // The process's server, or none before construction.
  static std::shared_ptr<TNDServer> server();

  // Resumes the listener, then runs the main loop for good.
  [[noreturn]] void run();

  // Queues `work` on the service queue for `client` and returns at once.
  // Work of one client runs in the order submitted; clients take turns.
  void submitWork(const TNDRelayClient* client, std::function<void()> work);

  // Cancels the listener, releases every hold and posts the
  // annotation-change notification (even with no holds). Runs on the main
  // queue (the SIGTERM handler).
  void stop();

  // True while no client is connected to any of the daemon's services, no
  // hold or other transaction is open (relay::keepAliveCount) and the
  // supervisor has no registration and no running instance: the daemon
  // could go without anyone losing anything. Threads: any.
  bool isIdle() const;
  // Stops accepting clients on every listener; clients already connected
  // are served on. Runs on the main queue (IdleExit).
  void stopAccepting();

  // Holds. All of them enter "serverSync" synchronously; those that change
  // the list post one annotation-change notification per hold added or
  // released, after leaving "serverSync". A hold blocks a plug-in for the
  // users it reaches (TNDPlugInHold).
  static constexpr size_t kHoldsPerClient = 64;
  bool holdOnPlugIn(const tn::UUID& plugIn, uid_t user);
  // Every plug-in some hold blocks for `user` now: one visit to
  // "serverSync" for a request that asks about many plug-ins.
  std::unordered_set<tn::UUID> heldPlugIns(uid_t user);
  // Adds the hold, unless its client already has kHoldsPerClient holds
  // (false: nothing added, nothing posted). A client's holds are few and
  // end with its connection, so this bounds what one client can make the
  // daemon keep.
  bool addHold(std::shared_ptr<TNDPlugInHold> hold);
  void unholdToken(const tn::UUID& token);
  void unholdClient(const std::shared_ptr<TNDRelayClient>& client);
  size_t holdCount();

  // Terminates the running instances of the records' plug-ins through the
  // supervisor (PlugInTermination) and runs `completion` on the call's own
  // "killer-waiter" queue once every answer has come. With `onlyForUser`,
  // only instances running as that user are terminated. Returns at once.
  void terminatePlugIns(const registrar::PlugInList& records, std::function<void()> completion,
                        std::optional<uid_t> onlyForUser = std::nullopt);

  // TNDatabaseDelegate: the running instances of uninstalled plug-ins are
  // terminated, for every user; holds stay as they are.
  void removedPlugIns(const registrar::PlugInList& records) override;

  uint32_t verbose() const { return verbose_; }
  void setVerbose(uint32_t verbose) { verbose_ = verbose; }
  const std::shared_ptr<tn::dispatch::SerialQueue>& relayQueue() const { return relayQueue_; }
  const std::shared_ptr<tn::dispatch::SerialQueue>& mainQueue() const { return mainQueue_; }
  const std::shared_ptr<tn::dispatch::SerialQueue>& syncQueue() const { return syncQueue_; }
  // The reader of the user's preferences (exclusions), made at start-up.
  const TNDUserPrefs& userPrefs() const { return userPrefs_; }
  // The administrator's settings (tenond.manifest), read once at start-up.
  const TNDConfiguration& configuration() const { return configuration_; }
  const std::shared_ptr<relay::Listener>& service() const { return service_; }

  // The process supervisor (platform/warden) and the busy-assertion service
  // (platform/vigil), made at start-up. Activation registers plug-ins with
  // warden()->addExternalService(client's audit token, executable path,
  // overlay); holds and uninstalls terminate with
  // warden()->removeExternalService(identifier, version, queue, reply);
  // checkBusy asks vigil()->busyInstances({identifier}). vigil() is null
  // when its service name could not be bound (logged at start-up).
  const std::shared_ptr<warden::Warden>& warden() const { return warden_; }
  const std::shared_ptr<vigil::Vigil>& vigil() const { return vigil_; }

 private:
  TNDServer() = default;
  void installListenerHandlers();
  void postAnnotationChanges(size_t count);
  // Makes the supervisor and the busy-assertion service and their relay
  // services; a service name that cannot be bound is logged, not fatal.
  void startPlatformServices();

  std::atomic<uint32_t> verbose_{0};
  std::shared_ptr<tn::dispatch::SerialQueue> relayQueue_;
  std::shared_ptr<tn::dispatch::SerialQueue> mainQueue_;
  std::shared_ptr<tn::dispatch::FairQueue> serviceTurns_;  // on mainQueue_
  std::shared_ptr<tn::dispatch::SerialQueue> syncQueue_;
  std::shared_ptr<relay::Listener> service_;
  std::vector<std::shared_ptr<TNDPlugInHold>> holds_;  // on syncQueue_ only
  std::shared_ptr<warden::Warden> warden_;
  std::unique_ptr<warden::WardenService> wardenService_;
  std::shared_ptr<vigil::Vigil> vigil_;
  TNDUserPrefs userPrefs_;
  TNDConfiguration configuration_;
};

}  // namespace tnd
