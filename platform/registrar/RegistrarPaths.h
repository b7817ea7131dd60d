#pragma once

// Where the registrar finds and keeps things, all under $TENON_ROOT but, for
// a per-user instance, its store and containers (platform/paths)
// (ARCHITECTURE.md section 8).

#include <string>
#include <vector>

namespace registrar {

struct RegistrarPaths {
  std::string root;                           // $TENON_ROOT, "" for the real system
  std::string storeFile;                      // <root>/var/lib/tenon/registrar.sqlite3
  std::vector<std::string> applicationRoots;  // scanned and watched
  std::string extensionPointsDirectory;       // <root>/usr/share/tenon/extension-points
  std::string containersDirectory;            // <root>/var/lib/tenon/containers
  std::string systemVolume;                   // <root>/System (bundles under it are on the system partition)
  std::string localeFile;                     // <root>/etc/locale.conf

  // Paths for the given root. The application roots are
  // <root>/System/Applications, <root>/usr/share/tenon/applications and
  // <root>/opt/tenon/applications, unless applicationDirectories (the value
  // of TENON_APP_DIRS: absolute paths separated by ':') names others.
  static RegistrarPaths forRoot(const std::string& root, const std::string& applicationDirectories = "");

  // forRoot($TENON_ROOT, $TENON_APP_DIRS), read when called; a per-user
  // instance's store and containers are its own (InstancePaths.h).
  static RegistrarPaths fromEnvironment();

  // True when path lies under the system volume.
  bool onSystemPartition(const std::string& path) const;
};

}  // namespace registrar
