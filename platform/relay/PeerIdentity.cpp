#include "platform/relay/PeerIdentity.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/relay/RelayError.h"
#include "platform/sandbox/SandboxCheck.h"

namespace relay {
namespace {

std::string executableLink(pid_t pid) { return fmt::format("/proc/{}/exe", pid); }

std::string readExecutableLink(pid_t pid) {
  std::array<char, 4096> buffer{};
  const ssize_t n = ::readlink(executableLink(pid).c_str(), buffer.data(), buffer.size());
  if (n <= 0 || static_cast<std::size_t>(n) == buffer.size()) return {};
  return std::string(buffer.data(), static_cast<std::size_t>(n));
}

// The file the process runs, opened as a path only: nothing is read, and a
// file of any type opens without blocking.
UniqueFd openExecutable(pid_t pid) {
  return UniqueFd(::open(executableLink(pid).c_str(), O_PATH | O_CLOEXEC));
}

tn::Error unidentified(std::string message) {
  return makeRelayError(RelayErrorCode::PeerUnidentified, std::move(message));
}

}  // namespace

tn::Result<PeerIdentity> PeerIdentity::ofSocketPeer(int socketFd) {
  tn::Result<AuditToken> token = AuditToken::ofSocketPeer(socketFd);
  if (!token.ok()) return token.error();
  PeerIdentity identity;
  identity.auditToken = std::move(*token);
  identity.executablePath = readExecutableLink(identity.auditToken.pid);
  const UniqueFd executable = openExecutable(identity.auditToken.pid);
  struct stat status {};
  if (executable.valid() && ::fstat(executable.get(), &status) == 0) {
    identity.executableKnown = true;
    identity.executableDevice = status.st_dev;
    identity.executableInode = status.st_ino;
  }
  identity.seccompFilters = sandbox::seccompFilterCount(identity.auditToken.pid);
  if (!identity.auditToken.stillSameProcess()) {
    return unidentified(
        fmt::format("the peer process {} changed while it was identified", identity.auditToken.pid));
  }
  return identity;
}

tn::Result<UniqueFd> PeerIdentity::openRunningExecutable() const {
  const pid_t pid = auditToken.pid;
  if (!executableKnown) return unidentified(fmt::format("the executable of pid {} was not known", pid));
  UniqueFd executable = openExecutable(pid);
  const int openError = errno;
  // Checked after opening: while the token still names the process, the
  // file opened is that process's.
  if (!auditToken.stillSameProcess()) return unidentified(fmt::format("pid {} has exited", pid));
  if (!executable.valid())
    return unidentified(fmt::format("cannot open the executable of pid {}: {}", pid, std::strerror(openError)));
  struct stat status {};
  if (::fstat(executable.get(), &status) != 0)
    return unidentified(fmt::format("cannot examine the executable of pid {}: {}", pid, std::strerror(errno)));
  if (status.st_dev != executableDevice || status.st_ino != executableInode)
    return unidentified(fmt::format("pid {} runs another executable than when it connected", pid));
  return executable;
}

}  // namespace relay
