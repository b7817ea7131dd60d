#include "platform/relay/AuditToken.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <optional>
#include <string_view>

#include <fmt/format.h>

#include "platform/relay/ProcessStartTime.h"
#include "platform/relay/RelayError.h"

// Older C library headers lack the options; the kernel's numbers are stable.
#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif
#ifndef SO_PEERGROUPS
#define SO_PEERGROUPS 59
#endif

namespace relay {
namespace {

tn::Error unidentified(std::string message) {
  return makeRelayError(RelayErrorCode::PeerUnidentified, std::move(message));
}

// The pidfd of the peer from SO_PEERPIDFD, or an invalid fd when the kernel
// does not have the option.
UniqueFd peerPidfd(int socketFd) {
  int pidfd = -1;
  socklen_t size = sizeof pidfd;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &size) != 0) return UniqueFd();
  return UniqueFd(pidfd);
}

UniqueFd openPidfd(pid_t pid) {
  const long fd = ::syscall(SYS_pidfd_open, pid, 0);
  return UniqueFd(fd < 0 ? -1 : static_cast<int>(fd));
}

// The "Pid:" line of a pidfd's fdinfo: the pid it refers to, -1 once the
// process has exited; none when the kernel does not say.
std::optional<long> pidOfPidfd(int pidfd) {
  const std::string path = fmt::format("/proc/self/fdinfo/{}", pidfd);
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;
  std::array<char, 1024> buffer{};
  const ssize_t n = ::read(fd.get(), buffer.data(), buffer.size());
  if (n <= 0) return std::nullopt;
  const std::string_view text(buffer.data(), static_cast<std::size_t>(n));
  constexpr std::string_view kKey = "\nPid:";
  std::size_t at = text.find(kKey);
  if (at == std::string_view::npos) return std::nullopt;
  at = text.find_first_not_of(" \t", at + kKey.size());
  if (at == std::string_view::npos) return std::nullopt;
  long pid = 0;
  const auto [ptr, ec] = std::from_chars(text.data() + at, text.data() + text.size(), pid);
  if (ec != std::errc() || ptr == text.data() + at) return std::nullopt;
  return pid;
}

// The supplementary groups the peer had when it connected. The kernel says
// how many there are when the buffer is too small (ERANGE), so a second call
// gets them all; none when the kernel has no SO_PEERGROUPS.
std::vector<gid_t> peerGroups(int socketFd) {
  std::vector<gid_t> groups(32);
  for (int attempt = 0; attempt < 2; ++attempt) {
    socklen_t size = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &size) == 0) {
      groups.resize(size / sizeof(gid_t));
      return groups;
    }
    if (errno != ERANGE) break;
    groups.resize(size / sizeof(gid_t) + 1);
  }
  return {};
}

// A pidfd becomes readable when its process exits.
bool pidfdReportsExit(int pidfd) {
  pollfd entry{pidfd, POLLIN, 0};
  while (true) {
    const int ready = ::poll(&entry, 1, 0);
    if (ready >= 0) return ready > 0;
    if (errno != EINTR) return true;
  }
}

// Attaches a pidfd for token.pid to the token (see the header for the two ways).
tn::Result<void> attachPidfd(AuditToken& token, int socketFd, std::optional<uint64_t> startBefore) {
  UniqueFd fromSocket = peerPidfd(socketFd);
  if (fromSocket.valid()) {
    const std::optional<long> pid = pidOfPidfd(fromSocket.get());
    if (pid && *pid != token.pid) {
      return unidentified(pid == -1L ? "the peer process has exited"
                                     : fmt::format("pidfd names pid {}, credentials name pid {}",
                                                   *pid, token.pid));
    }
    token.pidfd = std::make_shared<const UniqueFd>(std::move(fromSocket));
    token.pidfdSource = AuditToken::PidfdSource::PeerSocket;
    return {};
  }
  UniqueFd opened = openPidfd(token.pid);
  if (!opened.valid()) {
    if (errno == ENOSYS) return {};  // no pidfds on this kernel: start time only
    return unidentified(fmt::format("cannot open a pidfd for pid {}", token.pid));
  }
  if (startBefore != processStartTime(token.pid)) {
    return unidentified(fmt::format("pid {} changed hands while it was identified", token.pid));
  }
  token.pidfd = std::make_shared<const UniqueFd>(std::move(opened));
  token.pidfdSource = AuditToken::PidfdSource::OpenedByPid;
  return {};
}

}  // namespace

tn::Result<AuditToken> AuditToken::ofSocketPeer(int socketFd) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
    return makeSystemError("getsockopt(SO_PEERCRED)", errno);
  }
  if (credentials.pid <= 0) return unidentified("the peer has no pid visible here");
  AuditToken token;
  token.pid = credentials.pid;
  token.uid = credentials.uid;
  token.gid = credentials.gid;
  token.groups = peerGroups(socketFd);
  const std::optional<uint64_t> startBefore = processStartTime(token.pid);
  if (tn::Result<void> attached = attachPidfd(token, socketFd, startBefore); !attached.ok()) {
    return attached.error();
  }
  const std::optional<uint64_t> start = processStartTime(token.pid);
  if (!start) return unidentified(fmt::format("pid {} has no process information", token.pid));
  token.startTime = *start;
  if (token.pidfd && pidfdReportsExit(token.pidfd->get())) {
    return unidentified(fmt::format("the peer process {} has exited", token.pid));
  }
  return token;
}

bool AuditToken::isMemberOf(gid_t group) const {
  return gid == group || std::find(groups.begin(), groups.end(), group) != groups.end();
}

bool AuditToken::stillSameProcess() const {
  if (pidfd && pidfdReportsExit(pidfd->get())) return false;
  const std::optional<uint64_t> start = processStartTime(pid);
  return start && *start == startTime;
}

std::string AuditToken::description() const {
  return fmt::format("pid={} uid={} gid={} start={}", pid, uid, gid, startTime);
}

}  // namespace relay
