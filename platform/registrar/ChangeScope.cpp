#include "platform/registrar/ChangeScope.h"

namespace registrar {
namespace {

// path is directory itself or lies below it.
bool isAtOrBelow(const std::string& path, const std::string& directory) {
  return path == directory || (path.size() > directory.size() && path.starts_with(directory) &&
                               path[directory.size()] == '/');
}

// The registered bundles and the directories they lie in: few (each one
// added by hand), gathered once per batch of changes.
struct Registered {
  std::set<std::string> bundles;
  std::set<std::string> parents;

  explicit Registered(const State& state) {
    for (const auto& [path, plugIn] : state.storedPlugIns) {
      if (!plugIn.registeredByURL) continue;
      bundles.insert(path);
      parents.insert(path.substr(0, path.rfind('/')));
    }
  }

  // The registered bundle that path names or lies in; null when none.
  const std::string* bundleOf(const std::string& path) const {
    for (std::string candidate = path;; candidate.resize(candidate.rfind('/'))) {
      if (const auto found = bundles.find(candidate); found != bundles.end()) return &*found;
      if (candidate.rfind('/') == 0 || candidate.rfind('/') == std::string::npos) return nullptr;
    }
  }
};

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
  const Registered registered(state);
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
    if (const std::string* bundle = registered.bundleOf(path)) {
      scope.registered.insert(*bundle);
      continue;
    }
    // The parent of a registered bundle is watched for the bundle's own
    // removal or renaming; its other entries are nothing to the registry.
    // Any other path is unexpected: look at everything.
    if (!registered.parents.contains(path.substr(0, path.rfind('/')))) scope.everything = true;
  }
  return scope;
}

}  // namespace registrar
