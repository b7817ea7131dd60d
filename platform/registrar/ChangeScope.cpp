#include "platform/registrar/ChangeScope.h"

namespace registrar {
namespace {

// path is directory itself or lies below it.
bool isAtOrBelow(const std::string& path, const std::string& directory) {
  return path == directory || (path.size() > directory.size() && path.starts_with(directory) &&
                               path[directory.size()] == '/');
}

// The registered bundle that path names, lies in, or is the parent of an
// event about; null when none.
const std::string* registeredBundleOf(const std::string& path, const State& state) {
  // Registered bundles are few (each one added by hand): a scan is cheap.
  for (const auto& [bundlePath, plugIn] : state.storedPlugIns) {
    if (plugIn.registeredByURL && isAtOrBelow(path, bundlePath)) return &bundlePath;
  }
  return nullptr;
}

}  // namespace

std::string ChangeScope::groupOf(const std::string& path, const RegistrarPaths& paths) {
  for (const std::string& root : paths.applicationRoots) {
    if (path.size() <= root.size() + 1 || !isAtOrBelow(path, root)) continue;
    const size_t end = path.find('/', root.size() + 1);
    return path.substr(0, end);
  }
  return std::string();
}

void ChangeScope::merge(const ChangeScope& other) {
  everything = everything || other.everything;
  applications.insert(other.applications.begin(), other.applications.end());
  registered.insert(other.registered.begin(), other.registered.end());
  extensionPoints = extensionPoints || other.extensionPoints;
}

ChangeScope ChangeScope::of(const WatchedChanges& changes, const RegistrarPaths& paths, const State& state) {
  ChangeScope scope;
  scope.everything = changes.overflowed;
  for (const std::string& path : changes.paths) {
    if (isAtOrBelow(path, paths.extensionPointsDirectory)) {
      scope.extensionPoints = true;
      continue;
    }
    bool inRoot = false;
    for (const std::string& root : paths.applicationRoots) {
      if (!isAtOrBelow(path, root)) continue;
      inRoot = true;
      if (path == root) {
        scope.everything = true;  // the root itself went or moved
        break;
      }
      const size_t start = root.size() + 1;
      const size_t end = path.find('/', start);
      const std::string name = path.substr(start, end == std::string::npos ? std::string::npos : end - start);
      if (!name.starts_with(".")) scope.applications.insert(root + "/" + name);
      break;
    }
    if (inRoot) continue;
    if (const std::string* bundle = registeredBundleOf(path, state)) {
      scope.registered.insert(*bundle);
      continue;
    }
    // The parent of a registered bundle is watched for the bundle's own
    // removal or renaming; its other entries are nothing to the registry.
    // Any other path is unexpected: look at everything.
    const std::string parent = path.substr(0, path.rfind('/'));
    bool parentOfRegistered = false;
    for (const auto& [bundlePath, plugIn] : state.storedPlugIns) {
      if (plugIn.registeredByURL && bundlePath.substr(0, bundlePath.rfind('/')) == parent) {
        parentOfRegistered = true;
        break;
      }
    }
    if (!parentOfRegistered) scope.everything = true;
  }
  return scope;
}

}  // namespace registrar
