#include "tenond/server/FileLimit.h"

#include <sys/resource.h>

#include <algorithm>

#include "platform/log/Log.h"

namespace tnd {
namespace {

// Descriptors kept for the daemon's own files.
constexpr std::size_t kOwnDescriptors = 256;
// Descriptors a connection may hold at once (socket, pidfd, and one more
// while the peer is identified).
constexpr std::size_t kDescriptorsPerConnection = 3;
constexpr std::size_t kDefaultPerUser = 64;
constexpr std::size_t kLeastTotal = 16;
// The default total when the descriptors allow more: every connection may
// hold tens of MiB at worst, and a machine with more than this many clients
// of one registry should say so (connections-total).
constexpr std::size_t kDefaultTotal = 4096;

std::size_t asSize(rlim_t limit) {
  return limit == RLIM_INFINITY ? std::size_t{1} << 20 : static_cast<std::size_t>(limit);
}

}  // namespace

std::size_t currentFileLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return 1024;
  return asSize(limit.rlim_cur);
}

std::size_t raiseFileLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return 1024;
  if (limit.rlim_cur != limit.rlim_max) {
    const rlim_t was = limit.rlim_cur;
    limit.rlim_cur = limit.rlim_max;
    if (::setrlimit(RLIMIT_NOFILE, &limit) == 0) {
      TN_LOG_INFO(tn::log::ops(), "raised the open file limit from {} to {}", asSize(was), asSize(limit.rlim_cur));
    } else {
      limit.rlim_cur = was;
    }
  }
  return asSize(limit.rlim_cur);
}

relay::Listener::Limits connectionLimits(std::size_t fileLimit, std::optional<std::size_t> perUser,
                                         std::optional<std::size_t> total) {
  const std::size_t affordable =
      std::max(kLeastTotal, (fileLimit > kOwnDescriptors ? fileLimit - kOwnDescriptors : 0) /
                                kDescriptorsPerConnection);
  relay::Listener::Limits limits;
  limits.connectionsPerUser = perUser.value_or(kDefaultPerUser);
  limits.connectionsTotal = std::min(total.value_or(std::min(kDefaultTotal, affordable)), affordable);
  if (total && *total > affordable) {
    TN_LOG_ERROR(tn::log::ops(),
                 "connections-total {} needs more open files than the limit of {} allows; using {}", *total,
                 fileLimit, affordable);
  }
  limits.privilegedReserve = std::max<std::size_t>(4, limits.connectionsTotal / 8);
  return limits;
}

}  // namespace tnd
