#include "platform/warden/SandboxProfile.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "platform/warden/SeccompProgram.h"
#include "platform/warden/WardenError.h"
#include "platform/paths/InstancePaths.h"

namespace warden {
namespace {

constexpr std::size_t kMaxNameLength = 64;

tn::Error malformed(const std::string& path, std::string message) {
  return makeWardenError(EINVAL, fmt::format("sandbox profile {}: {}", path, message));
}

tn::Result<std::vector<std::string>> readPaths(const tn::Value& list, std::string_view key, const std::string& path) {
  std::vector<std::string> paths;
  if (list.isNull()) return paths;
  const tn::Array* entries = list.array();
  if (entries == nullptr) return malformed(path, fmt::format("\"{}\" is not an array", key));
  if (entries->size() > kMaxProfilePaths) {
    return malformed(path, fmt::format("\"{}\" lists more than {} paths", key, kMaxProfilePaths));
  }
  for (const tn::Value& entry : *entries) {
    const std::string* text = entry.string();
    if (text == nullptr || !text->starts_with('/') || text->find('\0') != std::string::npos) {
      return malformed(path, fmt::format("\"{}\" holds {}, which is not an absolute path", key, entry.description()));
    }
    paths.push_back(*text);
  }
  return paths;
}

tn::Result<std::vector<std::string>> readSystemCalls(const tn::Value& list, const std::string& path) {
  std::vector<std::string> names;
  if (list.isNull()) return names;
  const tn::Array* entries = list.array();
  if (entries == nullptr) return malformed(path, "\"deny-system-calls\" is not an array");
  for (const tn::Value& entry : *entries) {
    const std::string* name = entry.string();
    if (name == nullptr || !isKnownSystemCall(*name)) {
      return malformed(path, fmt::format("\"deny-system-calls\" holds {}, which is no known system call",
                                         entry.description()));
    }
    names.push_back(*name);
  }
  return names;
}

}  // namespace

bool isProfileName(std::string_view name) {
  if (name.empty() || name.size() > kMaxNameLength) return false;
  for (const char c : name) {
    if (!((c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-')) return false;
  }
  return true;
}

std::string SandboxProfile::directory() {
  return paths::platformRoot() + "/usr/share/tenon/sandbox-profiles";
}

std::string SandboxProfile::pathOf(std::string_view name) { return fmt::format("{}/{}.manifest", directory(), name); }

tn::Result<SandboxProfile> SandboxProfile::load(std::string_view name) {
  if (!isProfileName(name)) return makeWardenError(EINVAL, fmt::format("{:?} is not a sandbox profile name", name));
  const std::string path = pathOf(name);
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    return makeWardenError(errno == ENOENT ? ENOENT : EINVAL,
                           fmt::format("sandbox profile {} cannot be read: {}", path, std::strerror(errno)));
  }
  tn::Result<tn::Value> document = tn::readDocumentFile(path);
  if (!document.ok()) return malformed(path, document.error().localizedDescription());
  return fromDocument(*document, name, path);
}

tn::Result<SandboxProfile> SandboxProfile::fromDocument(const tn::Value& document, std::string_view name,
                                                        const std::string& path) {
  const tn::Dictionary* entries = document.dictionary();
  if (entries == nullptr) return malformed(path, "the document is not a dictionary");
  for (const auto& [key, value] : *entries) {
    if (key != "version" && key != "read-only" && key != "read-write" && key != "deny-system-calls") {
      return malformed(path, fmt::format("unknown key \"{}\"", key));
    }
  }
  if (document["version"].uint64() != 1u) return malformed(path, "\"version\" is not 1");
  SandboxProfile profile;
  profile.name = std::string(name);
  auto readOnly = readPaths(document["read-only"], "read-only", path);
  if (!readOnly.ok()) return readOnly.error();
  auto readWrite = readPaths(document["read-write"], "read-write", path);
  if (!readWrite.ok()) return readWrite.error();
  auto calls = readSystemCalls(document["deny-system-calls"], path);
  if (!calls.ok()) return calls.error();
  profile.readOnly = std::move(*readOnly);
  profile.readWrite = std::move(*readWrite);
  profile.deniedSystemCalls = std::move(*calls);
  return profile;
}

}  // namespace warden
