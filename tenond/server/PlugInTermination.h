#pragma once

// PlugInTermination: one forced termination of the running instances of
// some plug-ins, as a hold with termination and an uninstall ask for it.
//
// Each call gets its own serial queues, "killer" for the supervisor's
// answers and "killer-waiter" for the count of them, so a supervisor that
// never answers leaves only that call waiting. For every record the
// supervisor is asked to remove the service (bundle identifier, version;
// "1" when the bundle has no BNBundleVersion); each answer is logged by its
// status; once every answer has come, the completion runs on
// "killer-waiter". With no records it runs as soon as the waiter starts.
//
// The waiter counts answers instead of blocking a thread on a semaphore:
// the log lines and the order of events are those of a waiter that waits
// for each reply in turn ("awaiting termination reply #i" before the i-th
// answer is taken, "sending termination reply" after the last), but a
// thousand pending terminations hold no thread of the shared pool, which a
// hostile client could otherwise fill with "lock" requests.

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/dispatch/SerialQueue.h"
#include "platform/registrar/Records.h"

namespace tnd {

class PlugInTermination {
 public:
  // Asks the supervisor to terminate the running instances of the service
  // (bundle identifier, version) and to call `reply` once on `queue` with
  // 0 (terminated), 3 (none running) or another non-zero error.
  using ServiceRemover = std::function<void(const std::string& bundleIdentifier, const std::string& version,
                                            std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                            std::function<void(int status)> reply)>;

  // Starts the termination of `records`' instances and returns at once;
  // `completion` runs on this call's "killer-waiter" queue after the last
  // answer.
  static void start(const registrar::PlugInList& records, const ServiceRemover& remover,
                    std::function<void()> completion);

  // The version the supervisor knows a record's bundle by: its
  // information dictionary's "BNBundleVersion", else "1".
  static std::string supervisorVersion(const registrar::PlugInRecord& record);

  // "[identifier(UUID), ...]", for log lines.
  static std::string describe(const registrar::PlugInList& records);

 private:
  class Waiter;
};

}  // namespace tnd
