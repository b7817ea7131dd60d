#pragma once

// Scanner: reads the roots, registered bundles and extension points into a
// ScanPlan, reusing the stored facts of every bundle whose fingerprint is
// unchanged (internal to tn_registrar; runs on the registrar queue).
//
// A full scan starts from an empty plan and reads everything. An
// incremental scan (startFrom + the scan functions for the changed units)
// keeps the current facts of everything else and reads only what changed.

#include <functional>
#include <optional>
#include <set>
#include <string>

#include "platform/registrar/BundleReader.h"
#include "platform/registrar/RegistrarPaths.h"
#include "platform/registrar/RegistrarState.h"
#include "platform/value/Result.h"

namespace registrar {

class InstallWatcher;

class Scanner {
 public:
  using Progress = std::function<void(size_t done, size_t total)>;

  Scanner(const State& current, const RegistrarPaths& paths, InstallWatcher* watcher, bool createContainers);

  // Every application of every root.
  void scanRoots(const Progress& progress);
  // The application at path (a directory entry of a root) and its plug-ins;
  // nothing when it is gone.
  void scanApplication(const std::string& path);
  // The plug-in at path into the plan; false when it was skipped (lastError
  // says why).
  bool scanPlugIn(const std::string& path, const std::optional<std::string>& appPath, bool registeredByURL);
  // Registered bundles are re-read from where they were registered; a
  // bundle an application now provides belongs to the application. With
  // only, just those paths.
  void scanRegistered(const std::optional<std::set<std::string>>& only = std::nullopt);
  void scanExtensionPoints();

  // Starts the plan from the current facts, without the applications (and
  // their plug-ins) and registered bundles named, and without the extension
  // points when withoutPoints.
  void startFrom(const std::set<std::string>& appPaths, const std::set<std::string>& registeredPaths,
                 bool withoutPoints);

  ScanPlan plan;
  std::optional<tn::Error> lastError;
  size_t examined = 0;  // applications and registered bundles looked at
  size_t read = 0;      // bundles read from disk (their fingerprint differed)

 private:
  void watch(const std::string& path);
  void skip(std::string_view what, const tn::Error& error);
  std::optional<std::string> dataContainer(const StoredPlugIn& plugIn);

  const State& current_;
  const RegistrarPaths& paths_;
  InstallWatcher* watcher_;
  bool createContainers_;
  ReadContext context_;
};

}  // namespace registrar
