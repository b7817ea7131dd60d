// Warden::start: from a host's request to a running, sandboxed plug-in.

#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/warden/LandlockRuleset.h"
#include "platform/warden/SandboxProfile.h"
#include "platform/warden/SeccompProgram.h"
#include "platform/warden/Spawner.h"
#include "platform/warden/Warden.h"
#include "platform/warden/WardenError.h"
#include "platform/paths/InstancePaths.h"

namespace warden {
namespace {

// $TENON_ROOT/var/lib/tenon/containers/<identifier>: the plug-in's data
// container, derived here from the identifier the supervisor read itself.
std::string containerPath(const std::string& bundleIdentifier) {
  return fmt::format("{}/{}", paths::currentLayout().containersDirectory, bundleIdentifier);
}

// The plug-in's environment: the overlay's, then what the supervisor sets
// itself (its socket's descriptor; the platform root and instance it was
// started in, so the plug-in reaches this instance's services).
std::vector<std::string> environmentFor(const Registration& registration) {
  const std::vector<std::string> instance = paths::instanceEnvironment();
  const auto ours = [&instance](const std::string& name) {
    if (name == kPluginSocketVariable || name == "TENON_ROOT") return true;
    return std::any_of(instance.begin(), instance.end(), [&name](const std::string& entry) {
      return entry.size() > name.size() && entry.starts_with(name) && entry[name.size()] == '=';
    });
  };
  std::vector<std::string> environment;
  for (const auto& [name, value] : registration.overlay.environment) {
    if (!ours(name)) environment.push_back(name + "=" + value);
  }
  environment.push_back(fmt::format("{}={}", kPluginSocketVariable, kPluginSocketDescriptor));
  environment.insert(environment.end(), instance.begin(), instance.end());
  return environment;
}

// The user the plug-in runs as: the host's. A supervisor that is not root
// can only start processes of its own user.
tn::Result<Credentials> userFor(const ProcessHandle& host) {
  tn::Result<Credentials> credentials = host.credentials();
  if (!credentials.ok()) return credentials.error();
  if (::geteuid() != 0 && credentials->uid != ::geteuid()) {
    return makeWardenError(EPERM, fmt::format("cannot start a plug-in as uid {}: the supervisor runs as uid {}",
                                              credentials->uid, ::geteuid()));
  }
  return credentials;
}

}  // namespace

tn::Result<Warden::Started> Warden::start(const relay::AuditToken& token, const std::string& plugIn) {
  tn::Result<ProcessHandle> host = ProcessHandle::fromToken(token);
  if (!host.ok()) return host.error();
  tn::Result<Registration> registration = [&] {
    const std::lock_guard lock(mutex_);
    return registrationForStartLocked(*host, plugIn);
  }();
  if (!registration.ok()) return registration.error();
  return launch(*host, *registration);
}

tn::Result<Registration> Warden::registrationForStartLocked(const ProcessHandle& host, const std::string& plugIn) {
  HostRecord* record = findHostLocked(host.pid(), host.startTime());
  const Registration* chosen = nullptr;
  if (record != nullptr) {
    const bool byPath = plugIn.starts_with('/');
    for (const Registration& registration : record->registrations) {
      // The latest registration of an identifier wins.
      if ((byPath ? registration.executablePath : registration.bundleIdentifier) == plugIn) chosen = &registration;
    }
  }
  if (chosen == nullptr) {
    return makeWardenError(EPERM, fmt::format("no plug-in {} is registered for process {}", plugIn, host.pid()));
  }
  if (instances_.size() >= limits_.instancesTotal) {
    return makeWardenError(EUSERS, fmt::format("{} plug-in instances run, the limit", limits_.instancesTotal));
  }
  if (instanceCountForHostLocked(host.pid(), host.startTime()) >= limits_.instancesPerHost) {
    return makeWardenError(EUSERS, fmt::format("process {} already runs {} plug-in instances, the limit",
                                               host.pid(), limits_.instancesPerHost));
  }
  return *chosen;
}

tn::Result<Warden::Started> Warden::launch(const ProcessHandle& host, const Registration& registration) {
  tn::Result<SandboxProfile> profile = SandboxProfile::load(registration.overlay.sandboxProfile);
  if (!profile.ok()) return profile.error();
  tn::Result<Credentials> user = userFor(host);
  if (!user.ok()) return user.error();

  std::vector<std::string> readOnly = profile->readOnly;
  readOnly.push_back(registration.bundlePath);
  std::vector<std::string> readWrite = profile->readWrite;
  readWrite.push_back(containerPath(registration.bundleIdentifier));
  tn::Result<relay::UniqueFd> ruleset = buildLandlockRuleset(readOnly, readWrite);
  if (!ruleset.ok()) return ruleset.error();

  int ends[2] = {-1, -1};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return makeSystemError("socketpair", errno);
  relay::UniqueFd hostEnd(ends[0]);
  SpawnPlan plan;
  plan.executable = registration.executablePath;
  plan.arguments = {registration.executablePath};
  plan.environment = environmentFor(registration);
  plan.changeUser = ::geteuid() == 0;
  plan.user = *user;
  plan.socket = relay::UniqueFd(ends[1]);
  plan.landlockRuleset = std::move(*ruleset);
  plan.seccompProgram = buildSeccompProgram(profile->deniedSystemCalls);
  tn::Result<ProcessHandle> process = spawn(plan);
  if (!process.ok()) return process.error();
  if (tn::Result<void> tracked = track(host, *process, user->uid, registration); !tracked.ok()) {
    process->signal(SIGKILL);
    return tracked.error();
  }
  TN_LOG_INFO(tn::log::ops(), "warden: started {} as process {} (uid {}, profile {}) for process {}",
              registration.bundleIdentifier, process->pid(), user->uid, profile->name, host.pid());
  InstanceInfo info{process->pid(), process->startTime(), host.pid(), user->uid, registration.bundleIdentifier,
                    registration.bundleVersion, registration.executablePath, profile->name};
  return Started{std::move(info), std::move(hostEnd)};
}

}  // namespace warden
