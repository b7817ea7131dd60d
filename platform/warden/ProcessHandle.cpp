#include "platform/warden/ProcessHandle.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>

#include <fmt/format.h>

#include "platform/relay/ProcessStartTime.h"
#include "platform/sandbox/ProcFiles.h"
#include "platform/warden/WardenError.h"

namespace warden {
namespace {

// The whitespace-separated numbers of a status field.
std::optional<std::vector<uint32_t>> numbers(std::string_view text) {
  std::vector<uint32_t> values;
  std::size_t at = 0;
  while (at < text.size()) {
    at = text.find_first_not_of(" \t", at);
    if (at == std::string_view::npos) break;
    uint32_t value = 0;
    const auto [end, error] = std::from_chars(text.data() + at, text.data() + text.size(), value);
    if (error != std::errc()) return std::nullopt;
    values.push_back(value);
    at = static_cast<std::size_t>(end - text.data());
    if (at < text.size() && text[at] != ' ' && text[at] != '\t') return std::nullopt;
  }
  return values;
}

bool pidfdReportsExit(int pidfd) {
  pollfd entry{pidfd, POLLIN, 0};
  for (;;) {
    const int ready = ::poll(&entry, 1, 0);
    if (ready >= 0) return ready > 0;
    if (errno != EINTR) return true;
  }
}

}  // namespace

std::optional<Credentials> parseStatusCredentials(std::string_view status) {
  const auto uids = sandbox::statusField(status, "Uid");
  const auto gids = sandbox::statusField(status, "Gid");
  const auto groups = sandbox::statusField(status, "Groups");
  if (!uids || !gids || !groups) return std::nullopt;
  const auto uidNumbers = numbers(*uids);
  const auto gidNumbers = numbers(*gids);
  const auto groupNumbers = numbers(*groups);
  if (!uidNumbers || uidNumbers->size() != 4 || !gidNumbers || gidNumbers->size() != 4 || !groupNumbers) {
    return std::nullopt;
  }
  Credentials credentials;
  credentials.uid = (*uidNumbers)[1];
  credentials.gid = (*gidNumbers)[1];
  credentials.groups.assign(groupNumbers->begin(), groupNumbers->end());
  return credentials;
}

tn::Result<ProcessHandle> ProcessHandle::open(pid_t pid) {
  if (pid <= 0) return makeWardenError(ESRCH, fmt::format("{} is no process id", pid));
  const std::optional<uint64_t> before = relay::processStartTime(pid);
  const long fd = ::syscall(SYS_pidfd_open, pid, 0);
  if (fd < 0) return makeSystemError(fmt::format("pidfd_open({})", pid), errno);
  auto pidfd = std::make_shared<const relay::UniqueFd>(static_cast<int>(fd));
  const std::optional<uint64_t> after = relay::processStartTime(pid);
  if (!before || before != after || pidfdReportsExit(pidfd->get())) {
    return makeWardenError(ESRCH, fmt::format("process {} ended or changed hands while it was opened", pid));
  }
  return ProcessHandle(pid, *after, std::move(pidfd));
}

tn::Result<ProcessHandle> ProcessHandle::fromToken(const relay::AuditToken& token) {
  if (!token.pidfd || !token.pidfd->valid()) {
    return makeWardenError(ESRCH, fmt::format("process {} has no pidfd", token.pid));
  }
  ProcessHandle handle(token.pid, token.startTime, token.pidfd);
  if (!handle.alive() || relay::processStartTime(token.pid) != token.startTime) {
    return makeWardenError(ESRCH, fmt::format("process {} has ended", token.pid));
  }
  return handle;
}

tn::Result<ProcessHandle> ProcessHandle::adoptChild(pid_t pid, relay::UniqueFd pidfd) {
  // Our own child cannot be reaped by anyone else, so the pid is still its
  // own; its stat exists until we reap it.
  const std::optional<uint64_t> start = relay::processStartTime(pid);
  if (!start) return makeWardenError(ESRCH, fmt::format("the started process {} has no process information", pid));
  return ProcessHandle(pid, *start, std::make_shared<const relay::UniqueFd>(std::move(pidfd)));
}

bool ProcessHandle::alive() const { return !pidfdReportsExit(pidfd_->get()); }

tn::Result<Credentials> ProcessHandle::credentials() const {
  const std::optional<std::string> status = sandbox::readProcFile(std::to_string(pid_), "status");
  // Checked after the read: while the pidfd shows the process alive and the
  // start time is unchanged, the status read was its own.
  if (!alive() || relay::processStartTime(pid_) != startTime_) {
    return makeWardenError(ESRCH, fmt::format("process {} has ended", pid_));
  }
  if (!status) return makeSystemError(fmt::format("read /proc/{}/status", pid_), errno);
  std::optional<Credentials> credentials = parseStatusCredentials(*status);
  if (!credentials) return makeWardenError(EINVAL, fmt::format("/proc/{}/status has no readable credentials", pid_));
  return *credentials;
}

bool ProcessHandle::signal(int signalNumber) const {
  return ::syscall(SYS_pidfd_send_signal, pidfd_->get(), signalNumber, nullptr, 0) == 0;
}

}  // namespace warden
