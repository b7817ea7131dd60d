#include "platform/registrar/RegistrarPaths.h"

#include <cstdlib>

#include "platform/bundle/BundlePaths.h"
#include "platform/paths/InstancePaths.h"

namespace registrar {
namespace {

std::string environment(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr ? value : "";
}

std::vector<std::string> splitDirectories(const std::string& list) {
  std::vector<std::string> directories;
  size_t start = 0;
  while (start <= list.size()) {
    const size_t end = std::min(list.find(':', start), list.size());
    const std::string entry = list.substr(start, end - start);
    if (!entry.empty()) directories.push_back(bundle::absoluteBundlePath(entry));
    start = end + 1;
  }
  return directories;
}

}  // namespace

RegistrarPaths RegistrarPaths::forRoot(const std::string& root, const std::string& applicationDirectories) {
  RegistrarPaths paths;
  paths.root = root.empty() ? "" : bundle::absoluteBundlePath(root);
  const std::string& r = paths.root;
  paths.storeFile = r + "/var/lib/tenon/registrar.sqlite3";
  paths.extensionPointsDirectory = r + "/usr/share/tenon/extension-points";
  paths.containersDirectory = r + "/var/lib/tenon/containers";
  paths.systemVolume = r + "/System";
  paths.localeFile = r + "/etc/locale.conf";
  paths.applicationRoots = splitDirectories(applicationDirectories);
  if (paths.applicationRoots.empty()) {
    paths.applicationRoots = {r + "/System/Applications", r + "/usr/share/tenon/applications",
                              r + "/opt/tenon/applications"};
  }
  return paths;
}

RegistrarPaths RegistrarPaths::fromEnvironment() {
  // A per-user instance keeps its own store and containers; what it scans
  // and reads is the system's.
  const paths::Layout layout = paths::currentLayout();
  RegistrarPaths found = forRoot(layout.root, environment("TENON_APP_DIRS"));
  if (layout.instance == paths::Instance::User) {
    found.storeFile = layout.registrarStore;
    found.containersDirectory = layout.containersDirectory;
  }
  return found;
}

bool RegistrarPaths::onSystemPartition(const std::string& path) const {
  return path.size() > systemVolume.size() && path.starts_with(systemVolume) && path[systemVolume.size()] == '/';
}

}  // namespace registrar
