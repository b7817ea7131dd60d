// platform/warden: the process supervisor (library tn_warden, namespace
// warden).
//
// Stands in for the platform's supervisor inside tenond, behind the narrow
// interface below, which a separate service could implement later without
// a change to the daemon:
//   - addExternalService: for a host process, register a plug-in executable
//     with its activation overlay (ActivationOverlay.h). The record is
//     keyed by the host's pidfd and start time, so a process that later gets
//     the same pid inherits nothing, and ends when the host ends (its pidfd
//     is watched on the I/O poller; nothing polls).
//   - removeExternalService: terminate every running instance of a service
//     (bundle identifier and version): SIGTERM, then SIGKILL after a grace
//     period; answer once, on the caller's queue, 0 when instances were
//     terminated, 3 when none ran.
//   - start (WardenService.h serves it to hosts): start a registered
//     executable for its host, as the host's user, in a sandbox
//     (SandboxProfile.h, LandlockRuleset.h, SeccompProgram.h, Spawner.h),
//     and hand the host its end of a socket pair whose other end the
//     plug-in finds on descriptor 3, named by TENON_PLUGIN_SOCKET.
//   - running instances, tracked by pidfd and reaped when they exit;
//     runningInstance() lets the busy-instance service (platform/vigil)
//     tell a plug-in from any other process.
//
// The bundle identifier and version of a registration are read from the
// Info.manifest of the bundle that contains the executable
// ("BNBundleIdentifier", required; "BNBundleVersion", "1" when absent):
// the supervisor trusts the file system it starts from, not what a caller
// says about it.
//
// Everything a host can make the supervisor hold is bounded (Limits).
//
// Threads: every member may be called from any thread. State is guarded by
// one mutex, held only for lookups and updates, never across a system call
// that can wait; exits are handled on the supervisor's own queue "warden".

#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/AuditToken.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"
#include "platform/warden/ProcessHandle.h"
#include "platform/warden/Registry.h"

namespace warden {

// The environment variable that tells a plug-in its socket's descriptor.
inline constexpr const char* kPluginSocketVariable = "TENON_PLUGIN_SOCKET";

// removeExternalService's answers.
inline constexpr int kTerminated = 0;
inline constexpr int kNoInstancesRunning = 3;

class Warden : public std::enable_shared_from_this<Warden> {
 public:
  struct Limits {
    std::size_t registrationsPerHost = 64;
    std::size_t registrationsTotal = 4096;
    std::size_t instancesPerHost = 16;
    std::size_t instancesTotal = 256;
    std::chrono::milliseconds terminationGrace{2000};
  };

  struct Started {
    InstanceInfo instance;
    relay::UniqueFd hostSocket;  // the host's end of the plug-in's socket
  };

  static std::shared_ptr<Warden> create(Limits limits);
  static std::shared_ptr<Warden> create() { return create(Limits{}); }

  // Registers `executablePath` with `overlay` for the host process. 0 on
  // success, else an errno number (WardenError.h); the reason is logged.
  // The pid form opens the process now; prefer the token form, whose
  // pidfd was taken when the host connected.
  int addExternalService(pid_t hostPid, const std::string& executablePath, const tn::Value& overlay);
  int addExternalService(const relay::AuditToken& host, const std::string& executablePath,
                         const tn::Value& overlay);
  // The same, with the error. Registering an executable again for the same
  // host replaces its earlier registration.
  tn::Result<void> registerExternalService(const ProcessHandle& host, const std::string& executablePath,
                                           const tn::Value& overlay);

  // Terminates the running instances of (bundleIdentifier, version) and
  // calls `reply` once on `queue`: kTerminated once every one has exited,
  // kNoInstancesRunning at once when none ran. With `onlyForUser`, only the
  // instances running as that user (started for that user's hosts) are
  // terminated, and kNoInstancesRunning means none of theirs ran. Returns
  // at once.
  void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                             std::shared_ptr<tn::dispatch::SerialQueue> queue, std::function<void(int)> reply,
                             std::optional<uid_t> onlyForUser = std::nullopt);

  // Starts, for the host the token names, the plug-in registered for it as
  // `plugIn`: a bundle identifier, or the absolute path of its executable.
  // Errors (domain "warden"): EPERM when nothing of that name is registered
  // for this host or its user cannot be taken, EUSERS over the instance
  // limits, ENOENT/EINVAL for a missing or malformed sandbox profile (the
  // message names the file), and the failures of starting.
  tn::Result<Started> start(const relay::AuditToken& host, const std::string& plugIn);

  // The running instance that is process (pid, startTime), if any.
  std::optional<InstanceInfo> runningInstance(pid_t pid, uint64_t startTime) const;

  // {"registrations": [...], "instances": [...]} of every host, or of the
  // one host (pid, start time) given.
  tn::Value listing(std::optional<std::pair<pid_t, uint64_t>> host = std::nullopt) const;

  std::size_t registrationCount() const;
  std::size_t instanceCount() const;

  Warden(const Warden&) = delete;
  Warden& operator=(const Warden&) = delete;

 private:
  explicit Warden(Limits limits);

  // Needs mutex_.
  HostRecord* findHostLocked(pid_t pid, uint64_t startTime);
  std::size_t registrationCountLocked() const;
  std::size_t instanceCountForHostLocked(pid_t pid, uint64_t startTime) const;
  tn::Result<Registration> registrationForStartLocked(const ProcessHandle& host, const std::string& plugIn);

  tn::Result<Registration> readRegistration(const std::string& executablePath, const tn::Value& overlay) const;
  tn::Result<void> addRegistration(const ProcessHandle& host, Registration registration);
  tn::Result<Started> launch(const ProcessHandle& host, const Registration& registration);
  tn::Result<void> track(const ProcessHandle& host, const ProcessHandle& process, uid_t uid,
                         const Registration& registration);

  // The "warden" queue.
  void hostEnded(pid_t pid, uint64_t startTime);
  void instanceEnded(pid_t pid, uint64_t startTime);
  void killSurvivors(const std::vector<std::pair<pid_t, uint64_t>>& processes);

  const Limits limits_;
  const std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  mutable std::mutex mutex_;
  std::vector<HostRecord> hosts_;                  // guarded by mutex_
  std::map<pid_t, InstanceRecord> instances_;      // guarded by mutex_
};

}  // namespace warden
