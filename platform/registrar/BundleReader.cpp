#include "platform/registrar/BundleReader.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/bundle/Bundle.h"
#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/codesign/EntitlementDocuments.h"
#include "platform/codesign/TrustRule.h"
#include "platform/log/Log.h"
#include "platform/registrar/Records.h"
#include "platform/registrar/Store.h"

namespace registrar {
namespace {

constexpr std::string_view kLocalizedInfoName = "InfoManifest.manifest";

tn::Error invalid(const std::string& path, std::string_view reason) {
  return registrarError(RegistrarErrorCode::InvalidBundle, fmt::format("{}: {}", path, reason));
}

void appendFileStamp(std::string& into, const std::string& path) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    into += "-;";
    return;
  }
  fmt::format_to(std::back_inserter(into), "{}:{}:{}.{}:{}.{}:{:o}:{};", static_cast<uint64_t>(info.st_ino),
                 static_cast<int64_t>(info.st_size), info.st_mtim.tv_sec, info.st_mtim.tv_nsec, info.st_ctim.tv_sec,
                 info.st_ctim.tv_nsec, info.st_mode, info.st_uid);
}

void appendLocalizedStamps(std::string& into, const std::string& bundlePath) {
  const std::string localized = bundle::joinPath(bundlePath, bundle::kLocalizedDirectoryName);
  std::vector<std::string> languages = directoryEntries(localized);
  if (languages.size() > kMaxLanguages) languages.resize(kMaxLanguages);
  for (const std::string& language : languages) {
    into += language;
    into += '=';
    appendFileStamp(into, localized + "/" + language + "/" + std::string(kLocalizedInfoName));
  }
}

std::string readReason(const tn::Error& error) { return error.message().value_or(error.description()); }

// The manifest of the bundle at path as a dictionary.
tn::Result<tn::Value> readInfo(const std::string& path) {
  std::string reason;
  if (!isDirectory(path, &reason)) return invalid(path, reason);
  const std::string manifest = bundle::joinPath(path, bundle::kInfoManifestName);
  tn::Result<tn::Value> info = bundle::readManifestFile(manifest);
  if (!info) return invalid(path, readReason(info.error()));
  if (!info->isDictionary()) return invalid(path, "Info.manifest is not a dictionary");
  return info;
}

// language -> {"BNBundleDisplayName", "BNBundleName"} of each readable
// Localized/<language>/InfoManifest.manifest. Bad files are logged and left
// out; they do not keep the bundle from being registered.
tn::Value readLocalizations(const std::string& bundlePath) {
  tn::Dictionary localizations;
  const std::string localized = bundle::joinPath(bundlePath, bundle::kLocalizedDirectoryName);
  std::vector<std::string> languages = directoryEntries(localized);
  if (languages.size() > kMaxLanguages) languages.resize(kMaxLanguages);
  for (const std::string& language : languages) {
    const std::string file = localized + "/" + language + "/" + std::string(kLocalizedInfoName);
    if (::access(file.c_str(), F_OK) != 0) continue;
    tn::Result<tn::Value> names = bundle::readManifestFile(file);
    if (!names || !names->isDictionary()) {
      TN_LOG_ERROR(tn::log::rg(), "ignoring localized names {}: {}", file,
                   names ? std::string("not a dictionary") : readReason(names.error()));
      continue;
    }
    tn::Dictionary kept;
    for (std::string_view key : {kBundleDisplayNameKey, kBundleNameKey}) {
      if ((*names)[key].isString()) kept.set(std::string(key), (*names)[key]);
    }
    localizations.set(language, std::move(kept));
  }
  return localizations;
}

// A bundle without an executable has entitlements only through its own
// Entitlements.manifest, which must then pass the trust rule by itself.
tn::Value manifestOnlyEntitlements(const std::string& bundlePath, const codesign::TrustSettings& trust) {
  const std::string path = bundle::joinPath(bundlePath, bundle::kEntitlementsManifestName);
  const int fd = bundle::openManifestFile(path);
  if (fd < 0) {
    if (errno != ENOENT) TN_LOG_ERROR(tn::log::rg(), "ignoring entitlements in {}: {}", path, std::strerror(errno));
    return tn::Dictionary();
  }
  const tn::Result<void> trusted = codesign::checkTrustedFile(fd, trust.daemonUser);
  tn::Result<tn::Value> document = bundle::readManifestDescriptor(fd, path);
  ::close(fd);
  if (!trusted) {
    TN_LOG_ERROR(tn::log::rg(), "ignoring entitlements in {}: {}", path, readReason(trusted.error()));
  } else if (!document) {
    TN_LOG_ERROR(tn::log::rg(), "ignoring entitlements in {}: {}", path, readReason(document.error()));
  } else if (!document->isDictionary()) {
    TN_LOG_ERROR(tn::log::rg(), "ignoring entitlements in {}: the document is not a dictionary", path);
  } else {
    return *document;
  }
  return tn::Dictionary();
}

tn::Value readEntitlements(const std::string& bundlePath, const codesign::TrustSettings& trust) {
  const std::shared_ptr<bundle::Bundle> plugIn = bundle::Bundle::create(bundlePath, bundle::CreateMode::BundlePath);
  if (plugIn) {
    if (const std::optional<std::string> executable = plugIn->executablePath()) {
      return codesign::loadEntitlements(*executable, trust);
    }
  }
  return manifestOnlyEntitlements(bundlePath, trust);
}

std::optional<std::string> plugInIdentifier(const tn::Value& info, const tn::Value& plugInDictionary) {
  if (const std::string* identifier = plugInDictionary[kExtensionIdentifierKey].string()) return *identifier;
  if (const std::string* identifier = info[kBundleIdentifierKey].string()) return *identifier;
  return std::nullopt;
}

void collectPlugIns(const std::string& bundlePath, int depth, std::vector<std::string>& into) {
  const std::string directory = bundle::joinPath(
      bundle::joinPath(bundlePath, bundle::kSupportDirectoryName), bundle::kPlugInsDirectoryName);
  for (const std::string& name : directoryEntries(directory)) {
    const std::string path = directory + "/" + name;
    std::string reason;
    if (!isDirectory(path, &reason)) {
      TN_LOG_ERROR(tn::log::rg(), "skipping plug-in {}: {}", path, reason);
      continue;
    }
    into.push_back(path);
    if (depth + 1 < kMaxPlugInNesting) collectPlugIns(path, depth + 1, into);
  }
}

}  // namespace

bool isDirectory(const std::string& path, std::string* reason) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    if (reason != nullptr) {
      struct stat link {};
      const bool dangling = errno == ENOENT && ::lstat(path.c_str(), &link) == 0 && S_ISLNK(link.st_mode);
      *reason = dangling ? "dangling symbolic link" : std::strerror(errno);
    }
    return false;
  }
  if (!S_ISDIR(info.st_mode)) {
    if (reason != nullptr) *reason = "not a directory";
    return false;
  }
  return true;
}

std::vector<std::string> directoryEntries(const std::string& path) {
  std::vector<std::string> names;
  DIR* stream = ::opendir(path.c_str());
  if (stream == nullptr) return names;
  while (const struct dirent* entry = ::readdir(stream)) {
    if (entry->d_name[0] == '.') continue;
    names.emplace_back(entry->d_name);
  }
  ::closedir(stream);
  std::sort(names.begin(), names.end());
  return names;
}

std::string entitlementsStamp(const codesign::TrustSettings& trust) {
  std::string stamp;
  appendFileStamp(stamp, trust.entitlementsDirectory);
  for (const std::string& name : directoryEntries(trust.entitlementsDirectory)) {
    appendFileStamp(stamp, trust.entitlementsDirectory + "/" + name);
  }
  return stamp;
}

std::string plugInFingerprint(const std::string& path, const tn::Value& info, const ReadContext& context) {
  std::string fingerprint;
  fingerprint.reserve(256);
  appendFileStamp(fingerprint, bundle::joinPath(path, bundle::kInfoManifestName));
  appendFileStamp(fingerprint, bundle::joinPath(path, bundle::kEntitlementsManifestName));
  if (const std::string* executable = info[bundle::kBundleExecutableKey].string();
      executable != nullptr && bundle::isPlainFileName(*executable)) {
    appendFileStamp(fingerprint, path + "/" + std::string(bundle::kExecutableDirectoryName) + "/" + *executable);
  }
  appendLocalizedStamps(fingerprint, path);
  fingerprint += context.stamp;
  return fingerprint;
}

std::string applicationFingerprint(const std::string& path, const ReadContext& context) {
  std::string fingerprint;
  appendFileStamp(fingerprint, bundle::joinPath(path, bundle::kInfoManifestName));
  fingerprint += ::access(bundle::joinPath(path, kPlaceholderMarker).c_str(), F_OK) == 0 ? "P;" : "-;";
  appendLocalizedStamps(fingerprint, path);
  fingerprint += context.stamp;
  return fingerprint;
}

tn::Result<StoredPlugIn> readPlugInBundle(const std::string& path, const ReadContext& context) {
  // The fingerprint comes first: a bundle that changes while it is read then
  // differs from its stored fingerprint at the next scan and is read again.
  tn::Result<tn::Value> info = readInfo(path);
  if (!info) return info.error();
  StoredPlugIn plugIn;
  plugIn.fingerprint = plugInFingerprint(path, *info, context);
  const tn::Value& extension = (*info)[kExtensionKey];
  if (!extension.isDictionary()) return invalid(path, "Info.manifest has no \"XTExtension\" dictionary");
  const std::optional<std::string> identifier = plugInIdentifier(*info, extension);
  if (!identifier || identifier->empty()) {
    return invalid(path, "Info.manifest names no identifier (no XTExtensionIdentifier, nor BNBundleIdentifier)");
  }
  plugIn.path = path;
  plugIn.identifier = *identifier;
  plugIn.info = std::move(*info);
  plugIn.entitlements = readEntitlements(path, context.trust);
  plugIn.localizations = readLocalizations(path);
  return plugIn;
}

tn::Result<StoredApp> readApplicationBundle(const std::string& path, const ReadContext& context) {
  std::string reason;
  if (!isDirectory(path, &reason)) return invalid(path, reason);
  StoredApp app;
  app.path = path;
  app.fingerprint = applicationFingerprint(path, context);
  app.placeholder = ::access(bundle::joinPath(path, kPlaceholderMarker).c_str(), F_OK) == 0;
  tn::Result<tn::Value> info = readInfo(path);
  if (info) {
    app.info = std::move(*info);
  } else if (!app.placeholder) {
    return info.error();  // a placeholder may still lack its manifest
  }
  app.localizations = readLocalizations(path);
  return app;
}

std::vector<std::string> plugInBundlePaths(const std::string& bundlePath) {
  std::vector<std::string> paths;
  collectPlugIns(bundlePath, 0, paths);
  std::sort(paths.begin(), paths.end());
  return paths;
}

}  // namespace registrar
