#include "platform/relay/PeerIdentity.h"

#include <unistd.h>

#include <array>

#include <fmt/format.h>

#include "platform/relay/RelayError.h"

namespace relay {
namespace {

std::string readExecutableLink(pid_t pid) {
  const std::string link = fmt::format("/proc/{}/exe", pid);
  std::array<char, 4096> buffer{};
  const ssize_t n = ::readlink(link.c_str(), buffer.data(), buffer.size());
  if (n <= 0 || static_cast<std::size_t>(n) == buffer.size()) return {};
  return std::string(buffer.data(), static_cast<std::size_t>(n));
}

}  // namespace

tn::Result<PeerIdentity> PeerIdentity::ofSocketPeer(int socketFd) {
  tn::Result<AuditToken> token = AuditToken::ofSocketPeer(socketFd);
  if (!token.ok()) return token.error();
  std::string executablePath = readExecutableLink(token->pid);
  PeerIdentity identity{std::move(*token), std::move(executablePath)};
  if (!identity.auditToken.stillSameProcess()) {
    return makeRelayError(RelayErrorCode::PeerUnidentified,
                          fmt::format("the peer process {} changed while it was identified",
                                      identity.auditToken.pid));
  }
  return identity;
}

}  // namespace relay
