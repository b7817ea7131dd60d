#pragma once

// The scale benchmark's platform root: a private directory (removed with
// the object) holding 1,000 applications of 10 plug-ins made by
// generate-registry-fixture, the registrar's store made from them before
// any daemon starts (so that every daemon starts warm), and the annotation
// file with one annotation per plug-in, under the plug-in's annotation key
// (its identifier), in the file's own format.

#include <string>
#include <vector>

#include "platform/value/UUID.h"

namespace tn::bench {

class ScaleRoot {
 public:
  // Makes the directory and points TENON_ROOT at it.
  ScaleRoot();
  ~ScaleRoot();
  ScaleRoot(const ScaleRoot&) = delete;
  ScaleRoot& operator=(const ScaleRoot&) = delete;

  const std::string& path() const { return path_; }
  std::string applicationsDirectory() const { return path_ + "/opt/tenon/applications"; }

 private:
  std::string path_;
};

struct ScaleFixture {
  std::vector<UUID> plugIns;            // every installed plug-in, as the store lists them
  std::vector<std::string> identifiers;  // the same plug-ins' identifiers
};

// Fills `root` as described above; fails unless the store lists
// applications * plugInsPerApplication plug-ins.
ScaleFixture makeScaleFixture(const ScaleRoot& root, int applications, int plugInsPerApplication);

// Writes a new application of `plugIns` plug-ins, in the fixture's form, at
// `directory` (which must not exist). Returns the plug-ins' bundle paths.
std::vector<std::string> writeApplication(const std::string& directory, const std::string& identifier,
                                          int plugIns);

// Writes the daemon's configuration document under `root`, with the modes
// the daemon trusts.
void writeDaemonConfiguration(const std::string& root, const std::string& json);

}  // namespace tn::bench
