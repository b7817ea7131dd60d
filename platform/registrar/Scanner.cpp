#include "platform/registrar/Scanner.h"

#include <filesystem>

#include <fmt/format.h>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/log/Log.h"
#include "platform/registrar/InstallWatcher.h"

namespace registrar {
namespace {

constexpr std::string_view kManifestSuffix = ".manifest";

}  // namespace

Scanner::Scanner(const State& current, const RegistrarPaths& paths, InstallWatcher* watcher, bool createContainers)
    : current_(current), paths_(paths), watcher_(watcher), createContainers_(createContainers) {
  context_.trust = codesign::TrustSettings::fromEnvironment();
  context_.stamp = entitlementsStamp(context_.trust);
}

void Scanner::startFrom(const std::set<std::string>& appPaths, const std::set<std::string>& registeredPaths,
                        bool withoutPoints) {
  for (const auto& [path, app] : current_.storedApps) {
    if (!appPaths.contains(path)) plan.apps.emplace(path, app);
  }
  for (const auto& [path, plugIn] : current_.storedPlugIns) {
    const bool ofChangedApp = plugIn.appPath && appPaths.contains(*plugIn.appPath);
    if (!ofChangedApp && !registeredPaths.contains(path)) plan.plugIns.emplace(path, plugIn);
  }
  if (!withoutPoints) plan.points = current_.storedPoints;
}

void Scanner::scanRoots(const Progress& progress) {
  std::vector<std::string> appPaths;
  for (const std::string& root : paths_.applicationRoots) {
    if (!isDirectory(root)) continue;
    watch(root);
    for (const std::string& name : directoryEntries(root)) appPaths.push_back(root + "/" + name);
  }
  for (size_t i = 0; i < appPaths.size(); ++i) {
    scanApplication(appPaths[i]);
    if (progress) progress(i + 1, appPaths.size());
  }
}

void Scanner::scanApplication(const std::string& path) {
  ++examined;
  const auto existing = current_.storedApps.find(path);
  std::optional<StoredApp> app;
  if (existing != current_.storedApps.end() &&
      existing->second.fingerprint == applicationFingerprint(path, context_)) {
    app = existing->second;
  } else {
    watch(path);  // before reading, so that nothing written meanwhile is missed
    ++read;
    tn::Result<StoredApp> readApp = readApplicationBundle(path, context_);
    if (!readApp) {
      skip("application", readApp.error());
      return;
    }
    app = std::move(*readApp);
  }
  watch(path);
  const std::string support = bundle::joinPath(path, bundle::kSupportDirectoryName);
  watch(support);
  watch(bundle::joinPath(support, bundle::kPlugInsDirectoryName));
  for (const std::string& plugInPath : plugInBundlePaths(path)) scanPlugIn(plugInPath, path, false);
  plan.apps.emplace(path, std::move(*app));
}

bool Scanner::scanPlugIn(const std::string& path, const std::optional<std::string>& appPath, bool registeredByURL) {
  // The Support/PlugIns of an application is watched by scanApplication;
  // a registered or nested bundle's parent is watched here.
  const std::string parent = path.substr(0, path.rfind('/'));
  if (!appPath || parent != bundle::joinPath(bundle::joinPath(*appPath, bundle::kSupportDirectoryName),
                                             bundle::kPlugInsDirectoryName)) {
    watch(parent);
  }
  watch(path);
  const auto existing = current_.storedPlugIns.find(path);
  const StoredPlugIn* old = existing != current_.storedPlugIns.end() ? &existing->second : nullptr;
  if (old != nullptr && old->appPath == appPath && old->registeredByURL == registeredByURL &&
      old->fingerprint == plugInFingerprint(path, old->info, context_)) {
    plan.plugIns.emplace(path, *old);
    return true;
  }
  ++read;
  tn::Result<StoredPlugIn> readPlugIn = readPlugInBundle(path, context_);
  if (!readPlugIn) {
    skip("plug-in", readPlugIn.error());
    lastError = readPlugIn.error();
    return false;
  }
  readPlugIn->appPath = appPath;
  readPlugIn->registeredByURL = registeredByURL;
  if (old != nullptr && old->sameContents(*readPlugIn)) {
    readPlugIn->uuid = old->uuid;
    readPlugIn->registered = old->registered;
    readPlugIn->container = old->container;
  } else {
    readPlugIn->uuid = tn::UUID::random();
    readPlugIn->registered = tn::Date::now();
    readPlugIn->container = dataContainer(*readPlugIn);
  }
  plan.plugIns.emplace(path, std::move(*readPlugIn));
  return true;
}

void Scanner::scanRegistered(const std::optional<std::set<std::string>>& only) {
  for (const auto& [path, plugIn] : current_.storedPlugIns) {
    if (!plugIn.registeredByURL || plan.plugIns.contains(path)) continue;
    if (only && !only->contains(path)) continue;
    ++examined;
    std::string reason;
    if (!isDirectory(path, &reason)) {
      TN_LOG_DEFAULT(tn::log::rg(), "registered plug-in {} is gone ({}); unregistering it", path, reason);
      continue;
    }
    scanPlugIn(path, std::nullopt, true);
  }
}

void Scanner::scanExtensionPoints() {
  const std::string& directory = paths_.extensionPointsDirectory;
  if (!isDirectory(directory)) return;
  watch(directory);
  for (const std::string& name : directoryEntries(directory)) {
    if (!name.ends_with(kManifestSuffix) || name.size() == kManifestSuffix.size()) continue;
    const std::string identifier = name.substr(0, name.size() - kManifestSuffix.size());
    const std::string path = directory + "/" + name;
    const std::string fingerprint = plugInFingerprint(path, tn::Value(), context_);
    const auto existing = current_.storedPoints.find(identifier);
    if (existing != current_.storedPoints.end() && existing->second.fingerprint == fingerprint) {
      plan.points.emplace(identifier, existing->second);
      continue;
    }
    tn::Result<tn::Value> sdk = bundle::readManifestFile(path);
    if (!sdk || !sdk->isDictionary()) {
      ++plan.skipped;
      TN_LOG_ERROR(tn::log::rg(), "skipping extension point {}: {}", path,
                   sdk ? std::string("not a dictionary") : sdk.error().message().value_or(""));
      continue;
    }
    plan.points.emplace(identifier, StoredExtensionPoint{identifier, path, std::move(*sdk), fingerprint});
  }
}

void Scanner::watch(const std::string& path) {
  if (watcher_ != nullptr) watcher_->watch(path);
}

void Scanner::skip(std::string_view what, const tn::Error& error) {
  ++plan.skipped;
  TN_LOG_ERROR(tn::log::rg(), "skipping {} {}", what, error.message().value_or(error.description()));
}

// $ROOT/var/lib/tenon/containers/<identifier>/ with tmp/, for plug-ins
// that are not data plug-ins and whose identifier can name a directory.
std::optional<std::string> Scanner::dataContainer(const StoredPlugIn& plugIn) {
  const std::string* protocol = plugIn.info[kExtensionKey][kExtensionProtocolKey].string();
  if (protocol != nullptr && *protocol == kDataProtocol) return std::nullopt;
  if (!bundle::isPlainFileName(plugIn.identifier)) {
    TN_LOG_ERROR(tn::log::rg(), "no data container for plug-in {}: identifier \"{}\" cannot name a directory",
                 plugIn.path, plugIn.identifier);
    return std::nullopt;
  }
  const std::string container = paths_.containersDirectory + "/" + plugIn.identifier;
  if (!createContainers_) return container;
  std::error_code error;
  std::filesystem::create_directories(container + "/tmp", error);
  if (error) {
    TN_LOG_ERROR(tn::log::rg(), "cannot create data container {}: {}", container, error.message());
    return std::nullopt;
  }
  return container;
}

}  // namespace registrar
