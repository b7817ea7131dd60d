#include "platform/warden/Warden.h"

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <mutex>

#include <fmt/format.h>

#include "platform/bundle/Bundle.h"
#include "platform/log/Log.h"
#include "platform/relay/KeepAlive.h"
#include "platform/warden/WardenError.h"

namespace warden {
namespace {

// One removal: counts down the instances it waits for and answers once.
// The SIGKILL timer is made after the instances were signalled, so an
// instance may exit (on the supervisor's queue) while it is being set: the
// timer and whether the removal answered are guarded together.
struct Removal {
  std::shared_ptr<tn::dispatch::SerialQueue> queue;
  std::function<void(int)> reply;
  std::atomic<std::size_t> remaining{0};

  void instanceExited() {
    if (remaining.fetch_sub(1) != 1) return;
    std::shared_ptr<relay::PollerWatch> timer;
    {
      const std::lock_guard lock(timerMutex_);
      answered_ = true;
      timer = std::move(killTimer_);
    }
    if (timer) timer->cancel();
    queue->async([reply = std::move(reply)] { reply(kTerminated); });
  }

  void setKillTimer(std::shared_ptr<relay::PollerWatch> timer) {
    {
      const std::lock_guard lock(timerMutex_);
      if (!answered_) {
        killTimer_ = std::move(timer);
        return;
      }
    }
    if (timer) timer->cancel();  // every instance exited already
  }

 private:
  std::mutex timerMutex_;
  std::shared_ptr<relay::PollerWatch> killTimer_;  // guarded by timerMutex_
  bool answered_ = false;                          // guarded by timerMutex_
};

}  // namespace

std::shared_ptr<Warden> Warden::create(Limits limits) { return std::shared_ptr<Warden>(new Warden(limits)); }

Warden::Warden(Limits limits) : limits_(limits), queue_(tn::dispatch::SerialQueue::create("warden")) {}

int Warden::addExternalService(pid_t hostPid, const std::string& executablePath, const tn::Value& overlay) {
  tn::Result<ProcessHandle> host = ProcessHandle::open(hostPid);
  tn::Result<void> registered = host.ok() ? registerExternalService(*host, executablePath, overlay)
                                          : tn::Result<void>(host.error());
  if (registered.ok()) return 0;
  TN_LOG_ERROR(tn::log::ops(), "warden: cannot register {} for process {}: {}", executablePath, hostPid,
               registered.error().localizedDescription());
  return static_cast<int>(registered.error().code());
}

int Warden::addExternalService(const relay::AuditToken& token, const std::string& executablePath,
                               const tn::Value& overlay) {
  tn::Result<ProcessHandle> host = ProcessHandle::fromToken(token);
  tn::Result<void> registered = host.ok() ? registerExternalService(*host, executablePath, overlay)
                                          : tn::Result<void>(host.error());
  if (registered.ok()) return 0;
  TN_LOG_ERROR(tn::log::ops(), "warden: cannot register {} for process {}: {}", executablePath, token.pid,
               registered.error().localizedDescription());
  return static_cast<int>(registered.error().code());
}

tn::Result<void> Warden::registerExternalService(const ProcessHandle& host, const std::string& executablePath,
                                                 const tn::Value& overlay) {
  tn::Result<Registration> registration = readRegistration(executablePath, overlay);
  if (!registration.ok()) return registration.error();
  return addRegistration(host, std::move(*registration));
}

tn::Result<Registration> Warden::readRegistration(const std::string& executablePath,
                                                  const tn::Value& overlay) const {
  tn::Result<ActivationOverlay> parsed = ActivationOverlay::parse(overlay);
  if (!parsed.ok()) return parsed.error();
  struct stat status {};
  if (!executablePath.starts_with('/') || ::stat(executablePath.c_str(), &status) != 0 ||
      !S_ISREG(status.st_mode) || (status.st_mode & 0111) == 0) {
    return makeWardenError(ENOENT, fmt::format("{} is no executable file", executablePath));
  }
  const std::shared_ptr<bundle::Bundle> bundle = bundle::Bundle::create(executablePath, bundle::CreateMode::ExecutablePath);
  if (!bundle || !bundle->bundlePath()) {
    return makeWardenError(ENOENT, fmt::format("{} is in no bundle", executablePath));
  }
  const tn::Value info = bundle->infoDictionary();
  const std::string* identifier = info["BNBundleIdentifier"].string();
  if (identifier == nullptr || identifier->empty()) {
    return makeWardenError(EINVAL, fmt::format("the bundle {} has no BNBundleIdentifier", *bundle->bundlePath()));
  }
  const std::string* version = info["BNBundleVersion"].string();
  return Registration{executablePath, *bundle->bundlePath(), *identifier,
                      version != nullptr && !version->empty() ? *version : "1", std::move(*parsed)};
}

tn::Result<void> Warden::addRegistration(const ProcessHandle& host, Registration registration) {
  const std::lock_guard lock(mutex_);
  HostRecord* record = findHostLocked(host.pid(), host.startTime());
  if (record != nullptr) {
    for (Registration& existing : record->registrations) {
      if (existing.executablePath == registration.executablePath) {
        existing = std::move(registration);
        return {};
      }
    }
  }
  if (registrationCountLocked() >= limits_.registrationsTotal) {
    return makeWardenError(EUSERS, fmt::format("the supervisor holds {} registrations, its limit",
                                               limits_.registrationsTotal));
  }
  if (record != nullptr && record->registrations.size() >= limits_.registrationsPerHost) {
    return makeWardenError(EUSERS, fmt::format("process {} already has {} registrations, the limit", host.pid(),
                                               limits_.registrationsPerHost));
  }
  if (record == nullptr) {
    const std::weak_ptr<Warden> weak = weak_from_this();
    auto watch = relay::PollerWatch::whenReadable(host.pidfd(), queue_, [weak, pid = host.pid(),
                                                                          start = host.startTime()] {
      if (const auto self = weak.lock()) self->hostEnded(pid, start);
    });
    if (!watch) return makeSystemError("watching the host process", errno);
    hosts_.push_back(HostRecord{host, {}, std::move(watch)});
    record = &hosts_.back();
  }
  TN_LOG_INFO(tn::log::ops(), "warden: {} ({}) registered for process {}", registration.bundleIdentifier,
              registration.executablePath, host.pid());
  record->registrations.push_back(std::move(registration));
  return {};
}

void Warden::hostEnded(pid_t pid, uint64_t startTime) {
  {
    const std::lock_guard lock(mutex_);
    const auto ended = std::find_if(hosts_.begin(), hosts_.end(),
                                    [&](const HostRecord& host) { return host.host.sameProcess(pid, startTime); });
    if (ended == hosts_.end()) return;
    TN_LOG_INFO(tn::log::ops(), "warden: process {} ended; its {} registrations go with it", pid,
                ended->registrations.size());
    hosts_.erase(ended);
  }
  relay::activityEnded();  // fewer registrations: an idle exit looks again
}

void Warden::removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                                   std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                   std::function<void(int)> reply, std::optional<uid_t> onlyForUser) {
  auto removal = std::make_shared<Removal>();
  removal->queue = std::move(queue);
  removal->reply = std::move(reply);
  std::vector<std::pair<pid_t, uint64_t>> signalled;
  {
    const std::lock_guard lock(mutex_);
    for (auto& [pid, instance] : instances_) {
      if (instance.registration.bundleIdentifier != bundleIdentifier ||
          instance.registration.bundleVersion != version || (onlyForUser && instance.uid != *onlyForUser)) {
        continue;
      }
      instance.onExit.push_back([removal] { removal->instanceExited(); });
      signalled.emplace_back(pid, instance.process.startTime());
      instance.process.signal(SIGTERM);
    }
    removal->remaining = signalled.size();
  }
  if (signalled.empty()) {
    removal->queue->async([reply = std::move(removal->reply)] { reply(kNoInstancesRunning); });
    return;
  }
  TN_LOG_INFO(tn::log::ops(), "warden: terminating {} instances of {}({})", signalled.size(), bundleIdentifier,
              version);
  const std::weak_ptr<Warden> weak = weak_from_this();
  removal->setKillTimer(relay::PollerWatch::after(limits_.terminationGrace, queue_, [weak, signalled] {
    if (const auto self = weak.lock()) self->killSurvivors(signalled);
  }));
}

void Warden::killSurvivors(const std::vector<std::pair<pid_t, uint64_t>>& processes) {
  const std::lock_guard lock(mutex_);
  for (const auto& [pid, startTime] : processes) {
    const auto found = instances_.find(pid);
    if (found == instances_.end() || found->second.process.startTime() != startTime) continue;
    TN_LOG_DEFAULT(tn::log::ops(), "warden: instance {} of {} outlived its grace period; killing it", pid,
                   found->second.registration.bundleIdentifier);
    found->second.process.signal(SIGKILL);
  }
}

tn::Result<void> Warden::track(const ProcessHandle& host, const ProcessHandle& process, uid_t uid,
                               const Registration& registration) {
  const std::weak_ptr<Warden> weak = weak_from_this();
  auto watch = relay::PollerWatch::whenReadable(process.pidfd(), queue_, [weak, pid = process.pid(),
                                                                           start = process.startTime()] {
    if (const auto self = weak.lock()) self->instanceEnded(pid, start);
  });
  if (!watch) return makeSystemError("watching the started plug-in", errno);
  const std::lock_guard lock(mutex_);
  instances_.insert_or_assign(process.pid(), InstanceRecord{process, host.pid(), host.startTime(), uid,
                                                            registration, std::move(watch), {}});
  return {};
}

void Warden::instanceEnded(pid_t pid, uint64_t startTime) {
  std::vector<std::function<void()>> waiting;
  {
    const std::lock_guard lock(mutex_);
    const auto found = instances_.find(pid);
    if (found == instances_.end() || found->second.process.startTime() != startTime) return;
    // Reaped through its pidfd: no zombie stays behind, and no other child's
    // status is taken.
    siginfo_t status{};
    ::waitid(static_cast<idtype_t>(P_PIDFD), static_cast<id_t>(found->second.process.pidfd()), &status,
             WEXITED | WNOHANG);
    TN_LOG_INFO(tn::log::ops(), "warden: instance {} of {} exited (code {}, status {})", pid,
                found->second.registration.bundleIdentifier, status.si_code, status.si_status);
    waiting = std::move(found->second.onExit);
    instances_.erase(found);
  }
  for (const auto& notify : waiting) notify();
  relay::activityEnded();  // one instance fewer: an idle exit looks again
}

std::optional<InstanceInfo> Warden::runningInstance(pid_t pid, uint64_t startTime) const {
  const std::lock_guard lock(mutex_);
  const auto found = instances_.find(pid);
  if (found == instances_.end() || found->second.process.startTime() != startTime) return std::nullopt;
  return describe(found->second);
}

tn::Value Warden::listing(std::optional<std::pair<pid_t, uint64_t>> host) const {
  const auto selected = [&](pid_t pid, uint64_t startTime) {
    return !host || (host->first == pid && host->second == startTime);
  };
  tn::Array registrations;
  tn::Array instances;
  const std::lock_guard lock(mutex_);
  for (const HostRecord& record : hosts_) {
    if (!selected(record.host.pid(), record.host.startTime())) continue;
    for (const Registration& registration : record.registrations) {
      registrations.push_back(registrationValue(record, registration));
    }
  }
  for (const auto& [pid, instance] : instances_) {
    if (selected(instance.hostPid, instance.hostStartTime)) instances.push_back(instanceValue(instance));
  }
  return tn::Dictionary{{"registrations", std::move(registrations)}, {"instances", std::move(instances)}};
}

std::size_t Warden::registrationCount() const {
  const std::lock_guard lock(mutex_);
  return registrationCountLocked();
}

std::size_t Warden::instanceCount() const {
  const std::lock_guard lock(mutex_);
  return instances_.size();
}

HostRecord* Warden::findHostLocked(pid_t pid, uint64_t startTime) {
  for (HostRecord& host : hosts_) {
    if (host.host.sameProcess(pid, startTime)) return &host;
  }
  return nullptr;
}

std::size_t Warden::registrationCountLocked() const {
  std::size_t count = 0;
  for (const HostRecord& host : hosts_) count += host.registrations.size();
  return count;
}

std::size_t Warden::instanceCountForHostLocked(pid_t pid, uint64_t startTime) const {
  return static_cast<std::size_t>(std::count_if(instances_.begin(), instances_.end(), [&](const auto& entry) {
    return entry.second.hostPid == pid && entry.second.hostStartTime == startTime;
  }));
}

}  // namespace warden
