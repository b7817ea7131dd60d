#pragma once

// ChangeScope: what a rescan must look at after the install watcher
// reported changed paths (internal to tn_registrar).
//
// A path under an application root belongs to the application named by its
// first component below the root (an entry starting with "." is no
// application: nothing). A path in or below a registered bundle, or naming
// it in its parent, belongs to that bundle; one under the extension point
// directory to the extension points. Anything else (a root itself renamed
// or removed, events lost) asks for a full rescan: correctness first.

#include <set>
#include <string>

#include "platform/registrar/InstallWatcher.h"
#include "platform/registrar/RegistrarPaths.h"
#include "platform/registrar/RegistrarState.h"

namespace registrar {

struct ChangeScope {
  bool everything = false;
  std::set<std::string> applications;  // paths of applications (present or gone)
  std::set<std::string> registered;    // paths of registered bundles
  bool extensionPoints = false;

  bool empty() const { return !everything && applications.empty() && registered.empty() && !extensionPoints; }
  // Joins other into this scope.
  void merge(const ChangeScope& other);

  static ChangeScope of(const WatchedChanges& changes, const RegistrarPaths& paths, const State& state);

  // The group of the install watcher a changed path belongs to: its
  // application ("<root>/<name>"), else "" (everything else together).
  // Needs only the paths: safe on the watcher's thread.
  static std::string groupOf(const std::string& path, const RegistrarPaths& paths);
};

}  // namespace registrar
