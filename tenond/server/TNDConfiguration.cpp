#include "tenond/server/TNDConfiguration.h"

#include <grp.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <vector>

#include <fmt/format.h>

#include "platform/bundle/ManifestFile.h"
#include "platform/codesign/TrustRule.h"
#include "platform/log/Log.h"
#include "platform/paths/InstancePaths.h"

namespace tnd {
namespace {

constexpr std::string_view kPrivilegedGroups = "privileged-groups";
constexpr std::string_view kConnectionsPerUser = "connections-per-user";
constexpr std::string_view kConnectionsTotal = "connections-total";
constexpr std::string_view kTerminationGrace = "termination-grace-seconds";
constexpr std::size_t kLongestTerminationGrace = 3600;
constexpr std::string_view kIdleExit = "idle-exit-seconds";
constexpr std::size_t kLongestIdleExit = 86400;

void logBadKey(const std::string& path, std::string_view key, std::string_view reason) {
  TN_LOG_ERROR(tn::log::ops(), "configuration {}: \"{}\" {}; using its default", path, key, reason);
}

std::string reasonOf(const tn::Error& error) { return error.message().value_or(error.description()); }

// The number of the group called name; none when there is no such group.
std::optional<gid_t> groupNamed(const std::string& name) {
  std::vector<char> buffer(16384);
  for (;;) {
    group entry{};
    group* found = nullptr;
    const int error = ::getgrnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
    if (error == ERANGE && buffer.size() < (1U << 20)) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    if (error != 0 || found == nullptr) return std::nullopt;
    return found->gr_gid;
  }
}

// One entry of "privileged-groups": a group name or a number.
std::optional<gid_t> groupOf(const tn::Value& entry) {
  if (const std::string* name = entry.string()) return groupNamed(*name);
  const std::optional<uint64_t> number = entry.uint64();
  // (gid_t)-1 means "no group" to the kernel's calls.
  if (!number || *number >= std::numeric_limits<gid_t>::max()) return std::nullopt;
  return static_cast<gid_t>(*number);
}

// Every entry must name a group, or the key falls back to its default: a
// typo must not quietly leave the intended group out while the rest counts.
std::optional<std::vector<gid_t>> readPrivilegedGroups(const tn::Value& value, const std::string& path) {
  const tn::Array* entries = value.array();
  if (entries == nullptr) {
    logBadKey(path, kPrivilegedGroups, "is not an array of group names or numbers");
    return std::nullopt;
  }
  std::vector<gid_t> groups;
  for (const tn::Value& entry : *entries) {
    const std::optional<gid_t> group = groupOf(entry);
    if (!group) {
      logBadKey(path, kPrivilegedGroups, fmt::format("has {}, which names no group", entry.description()));
      return std::nullopt;
    }
    groups.push_back(*group);
  }
  return groups;
}

std::optional<std::size_t> positiveCount(const tn::Value& value, std::string_view key, const std::string& path) {
  const std::optional<uint64_t> number = value.uint64();
  if (!number || *number == 0 || *number > std::numeric_limits<std::size_t>::max()) {
    logBadKey(path, key, "is not a positive integer");
    return std::nullopt;
  }
  return static_cast<std::size_t>(*number);
}

// 0 (never) or a number of seconds up to kLongestIdleExit.
std::optional<std::size_t> readIdleExitSeconds(const tn::Value& value, const std::string& path) {
  const std::optional<uint64_t> number = value.uint64();
  if (!number || *number > kLongestIdleExit) {
    logBadKey(path, kIdleExit, fmt::format("is not an integer from 0 to {}", kLongestIdleExit));
    return std::nullopt;
  }
  return static_cast<std::size_t>(*number);
}

}  // namespace

std::string TNDConfiguration::path() {
  return paths::currentLayout().configurationFile;
}

TNDConfiguration TNDConfiguration::fromDocument(const tn::Value& document, const std::string& path) {
  TNDConfiguration configuration;
  const tn::Dictionary* entries = document.dictionary();
  if (entries == nullptr) {
    TN_LOG_ERROR(tn::log::ops(), "configuration {} ignored: the document is not a dictionary", path);
    return configuration;
  }
  for (const auto& [key, value] : *entries) {
    if (key == kPrivilegedGroups) {
      configuration.privilegedGroups = readPrivilegedGroups(value, path).value_or(std::vector<gid_t>{});
    } else if (key == kConnectionsPerUser) {
      configuration.connectionsPerUser = positiveCount(value, key, path);
    } else if (key == kConnectionsTotal) {
      configuration.connectionsTotal = positiveCount(value, key, path);
    } else if (key == kTerminationGrace) {
      configuration.terminationGraceSeconds = positiveCount(value, key, path);
      if (configuration.terminationGraceSeconds > kLongestTerminationGrace) {
        logBadKey(path, key, fmt::format("is more than {}", kLongestTerminationGrace));
        configuration.terminationGraceSeconds.reset();
      }
    } else if (key == kIdleExit) {
      configuration.idleExitSeconds = readIdleExitSeconds(value, path);
    } else {
      TN_LOG_ERROR(tn::log::ops(), "configuration {}: unknown key \"{}\" ignored", path, key);
    }
  }
  return configuration;
}

TNDConfiguration TNDConfiguration::load() {
  const std::string file = path();
  const int fd = bundle::openManifestFile(file);
  if (fd < 0) {
    if (errno != ENOENT) TN_LOG_ERROR(tn::log::ops(), "configuration {} ignored: {}", file, std::strerror(errno));
    return {};
  }
  // Checked on the open file before it is read: what is checked is what is read.
  const tn::Result<void> trusted = codesign::checkTrustedFile(fd, ::geteuid());
  tn::Result<tn::Value> document =
      trusted ? bundle::readManifestDescriptor(fd, file) : tn::Result<tn::Value>(trusted.error());
  ::close(fd);
  if (!document) {
    TN_LOG_ERROR(tn::log::ops(), "configuration {} ignored: {}", file, reasonOf(document.error()));
    return {};
  }
  return fromDocument(*document, file);
}

}  // namespace tnd

namespace tnd {

bool TNDConfiguration::isPrivilegedUser(const relay::AuditToken& token) const {
  if (token.uid == 0 || token.uid == ::geteuid()) return true;
  return std::any_of(privilegedGroups.begin(), privilegedGroups.end(),
                     [&](gid_t group) { return token.isMemberOf(group); });
}

}  // namespace tnd
