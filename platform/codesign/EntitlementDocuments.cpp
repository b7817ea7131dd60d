#include "platform/codesign/EntitlementDocuments.h"

#include <dirent.h>
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>
#include <vector>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/codesign/TrustRule.h"
#include "platform/log/Log.h"

namespace codesign {
namespace {

constexpr std::string_view kManifestSuffix = ".manifest";

// A document read for the executable, and whether the trust rule let it in.
struct Candidate {
  std::string path;
  tn::Value entitlements;   // a dictionary
  tn::Result<void> trusted;
};

// A manifest's contents together with the trust rule's verdict on the very
// file that was read.
struct DocumentRead {
  tn::Result<tn::Value> value;
  tn::Result<void> trusted;
};

void logIgnoredDocument(const std::string& path, std::string_view reason) {
  TN_LOG_ERROR(tn::log::ops(), "ignoring entitlements in {}: {}", path, reason);
}

std::string reasonOf(const tn::Error& error) { return error.message().value_or(error.description()); }

// Links resolved when the path exists; the lexical absolute path otherwise.
std::string resolvedPath(const std::string& path) {
  char resolved[PATH_MAX];
  if (::realpath(path.c_str(), resolved) != nullptr) return resolved;
  return bundle::absoluteBundlePath(path);
}

// None when there is no file at path (quietly) or it cannot be opened
// (logged).
std::optional<DocumentRead> readEntitlementDocument(const std::string& path, const TrustSettings& settings) {
  const int fd = bundle::openManifestFile(path);
  if (fd < 0) {
    if (errno == ENOENT) return std::nullopt;
    logIgnoredDocument(path, std::strerror(errno));
    return std::nullopt;
  }
  DocumentRead document{bundle::readManifestDescriptor(fd, path), checkTrustedFile(fd, settings.daemonUser)};
  ::close(fd);
  return document;
}

std::optional<Candidate> bundleDocument(const std::string& executablePath, const TrustSettings& settings) {
  const std::optional<std::string> bundlePath = bundle::findEnclosingBundle(executablePath);
  if (!bundlePath) return std::nullopt;
  const std::string path = bundle::joinPath(*bundlePath, bundle::kEntitlementsManifestName);
  std::optional<DocumentRead> document = readEntitlementDocument(path, settings);
  if (!document) return std::nullopt;
  if (!document->value) {
    logIgnoredDocument(path, reasonOf(document->value.error()));
    return std::nullopt;
  }
  if (!document->value->isDictionary()) {
    logIgnoredDocument(path, "the document is not a dictionary");
    return std::nullopt;
  }
  return Candidate{path, *document->value, document->trusted};
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

// The entitlements of a document of the entitlements directory when it
// names the executable; none (logged when malformed) otherwise.
std::optional<Candidate> directoryDocument(const std::string& path, const std::string& executable,
                                           const TrustSettings& settings) {
  std::optional<DocumentRead> document = readEntitlementDocument(path, settings);
  if (!document) return std::nullopt;
  if (!document->value) {
    logIgnoredDocument(path, reasonOf(document->value.error()));
    return std::nullopt;
  }
  const tn::Value& value = *document->value;
  const std::string* named = value[kExecutableKey].string();
  if (!value.isDictionary() || named == nullptr || !named->starts_with('/') ||
      !value[kEntitlementsKey].isDictionary()) {
    logIgnoredDocument(path,
                       "expected a dictionary with an absolute \"executable\" path and an "
                       "\"entitlements\" dictionary");
    return std::nullopt;
  }
  if (resolvedPath(*named) != executable) return std::nullopt;
  return Candidate{path, value[kEntitlementsKey], document->trusted};
}

std::vector<Candidate> candidatesFor(const std::string& executable, const TrustSettings& settings) {
  std::vector<Candidate> candidates;
  if (std::optional<Candidate> inBundle = bundleDocument(executable, settings)) {
    candidates.push_back(std::move(*inBundle));
  }
  for (const std::string& name : manifestNames(settings.entitlementsDirectory)) {
    const std::string path = bundle::joinPath(settings.entitlementsDirectory, name);
    if (std::optional<Candidate> named = directoryDocument(path, executable, settings)) {
      candidates.push_back(std::move(*named));
    }
  }
  return candidates;
}

}  // namespace

tn::Value loadEntitlements(const std::string& executablePath, const TrustSettings& settings) {
  tn::Dictionary granted;
  if (executablePath.empty()) return granted;
  const std::string executable = resolvedPath(executablePath);
  const std::vector<Candidate> candidates = candidatesFor(executable, settings);
  if (candidates.empty()) return granted;

  const tn::Result<void> executableTrusted = checkTrustedPath(executable, settings.daemonUser);
  if (!executableTrusted) {
    TN_LOG_ERROR(tn::log::ops(), "ignoring entitlements of executable {}: {}", executable,
                 reasonOf(executableTrusted.error()));
    return granted;
  }
  for (const Candidate& candidate : candidates) {
    if (!candidate.trusted) {
      logIgnoredDocument(candidate.path, reasonOf(candidate.trusted.error()));
      continue;
    }
    for (const auto& [key, value] : *candidate.entitlements.dictionary()) granted.set(key, value);
  }
  return granted;
}

}  // namespace codesign
