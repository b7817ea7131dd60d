#include "platform/codesign/EntitlementDocuments.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>
#include <vector>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/codesign/DocumentCache.h"
#include "platform/codesign/FileIdentity.h"
#include "platform/codesign/TrustRule.h"
#include "platform/log/Log.h"

namespace codesign {
namespace {

constexpr std::string_view kManifestSuffix = ".manifest";

// A trusted document's entitlements (a dictionary) and where they came from.
struct Candidate {
  std::string path;
  tn::Value entitlements;
};

void logIgnoredDocument(const std::string& path, std::string_view reason) {
  TN_LOG_ERROR(tn::log::ops(), "ignoring entitlements in {}: {}", path, reason);
}

std::string reasonOf(const tn::Error& error) { return error.message().value_or(error.description()); }

// The document at path when it passes the trust rule and parses; none (logged
// unless there is no file at all) otherwise. The rule is checked on the open
// file before anything is read from it.
std::optional<tn::Value> readTrustedDocument(const std::string& path, const TrustSettings& settings) {
  const int fd = bundle::openManifestFile(path);
  if (fd < 0) {
    if (errno != ENOENT) logIgnoredDocument(path, std::strerror(errno));
    return std::nullopt;
  }
  std::optional<tn::Value> document;
  if (const tn::Result<void> trusted = checkTrustedFile(fd, settings.daemonUser); !trusted) {
    logIgnoredDocument(path, reasonOf(trusted.error()));
  } else if (const DocumentCache::Parsed parsed = DocumentCache::shared().read(fd, path); !*parsed) {
    logIgnoredDocument(path, reasonOf(parsed->error()));
  } else {
    document = **parsed;
  }
  ::close(fd);
  return document;
}

// The bundle's own document, for a trusted executable only.
std::optional<Candidate> bundleDocument(const std::string& executablePath, const FileIdentity& running,
                                        const TrustSettings& settings) {
  const std::optional<std::string> bundlePath = bundle::findEnclosingBundle(executablePath);
  if (!bundlePath) return std::nullopt;
  const std::string path = bundle::joinPath(*bundlePath, bundle::kEntitlementsManifestName);
  if (fileIdentityAt(executablePath) != running) {
    // The process runs another file than the one at that path here: one
    // mounted over it in the process's own mount namespace, or a file
    // replaced since it was started.
    if (::access(path.c_str(), F_OK) == 0)
      logIgnoredDocument(path, executablePath + " here is not the file the process runs");
    return std::nullopt;
  }
  std::optional<tn::Value> document = readTrustedDocument(path, settings);
  if (!document) return std::nullopt;
  if (!document->isDictionary()) {
    logIgnoredDocument(path, "the document is not a dictionary");
    return std::nullopt;
  }
  return Candidate{path, std::move(*document)};
}

std::vector<std::string> manifestNames(const std::string& directory) {
  std::vector<std::string> names;
  DIR* stream = ::opendir(directory.c_str());
  if (stream == nullptr) {
    if (errno != ENOENT) {
      TN_LOG_ERROR(tn::log::ops(), "cannot read entitlement documents in {}: {}", directory,
                   std::strerror(errno));
    }
    return names;
  }
  while (const struct dirent* entry = ::readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name.starts_with('.') || !name.ends_with(kManifestSuffix)) continue;
    names.emplace_back(name);
  }
  ::closedir(stream);
  std::sort(names.begin(), names.end());
  return names;
}

// The entitlements of a trusted document of the entitlements directory when
// it names the running file; none (logged when untrusted or malformed)
// otherwise.
std::optional<Candidate> directoryDocument(const std::string& path, const FileIdentity& running,
                                           const TrustSettings& settings) {
  std::optional<tn::Value> document = readTrustedDocument(path, settings);
  if (!document) return std::nullopt;
  const tn::Value& value = *document;
  const std::string* named = value[kExecutableKey].string();
  if (!value.isDictionary() || named == nullptr || !named->starts_with('/') ||
      !value[kEntitlementsKey].isDictionary()) {
    logIgnoredDocument(path,
                       "expected a dictionary with an absolute \"executable\" path and an "
                       "\"entitlements\" dictionary");
    return std::nullopt;
  }
  if (fileIdentityAt(*named) != running) return std::nullopt;
  return Candidate{path, value[kEntitlementsKey]};
}

std::vector<Candidate> directoryDocuments(const FileIdentity& running, const TrustSettings& settings) {
  std::vector<Candidate> candidates;
  for (const std::string& name : manifestNames(settings.entitlementsDirectory)) {
    const std::string path = bundle::joinPath(settings.entitlementsDirectory, name);
    if (std::optional<Candidate> named = directoryDocument(path, running, settings))
      candidates.push_back(std::move(*named));
  }
  return candidates;
}

}  // namespace

tn::Value loadEntitlements(const std::string& executablePath, int executableFd, const TrustSettings& settings) {
  tn::Dictionary granted;
  const std::optional<FileIdentity> running = fileIdentityOf(executableFd);
  if (executablePath.empty() || !running) return granted;

  if (const tn::Result<void> trusted = checkTrustedFile(executableFd, settings.daemonUser); !trusted) {
    // Only the administrator's documents are looked at, to say why they do
    // not apply; the executable's bundle is not touched.
    if (!directoryDocuments(*running, settings).empty()) {
      TN_LOG_ERROR(tn::log::ops(), "ignoring entitlements of executable {}: {}", executablePath,
                   reasonOf(trusted.error()));
    }
    return granted;
  }
  std::vector<Candidate> candidates;
  if (std::optional<Candidate> inBundle = bundleDocument(executablePath, *running, settings))
    candidates.push_back(std::move(*inBundle));
  for (Candidate& named : directoryDocuments(*running, settings)) candidates.push_back(std::move(named));
  for (const Candidate& candidate : candidates) {
    for (const auto& [key, value] : *candidate.entitlements.dictionary()) granted.set(key, value);
  }
  return granted;
}

tn::Value loadEntitlements(const std::string& executablePath, const TrustSettings& settings) {
  const int fd = ::open(executablePath.c_str(), O_PATH | O_CLOEXEC);
  if (fd < 0) return tn::Dictionary();
  tn::Value granted = loadEntitlements(executablePath, fd, settings);
  ::close(fd);
  return granted;
}

}  // namespace codesign
