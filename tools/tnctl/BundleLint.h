#pragma once

// Checking a plug-in bundle the way the registry will see it, before it
// ships (tnctl lint) or after the registrar refused it (tnctl add): the
// manifest's keys as the author wrote them (ManifestLint.h), then the
// record the registry builds, with the SDK of its extension point merged,
// canonicalised and diagnosed, then its executable.

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "libtenon/model/TNPlugInCore.h"
#include "tools/tnctl/ManifestLint.h"

namespace tnctl {

struct BundleLintResult {
  std::string path;                             // the bundle directory, absolute
  std::vector<LintFinding> findings;            // errors and warnings, in the order found
  int64_t errorcode = 0;                        // of the first error; 0 without errors
  std::shared_ptr<tn::TNPlugInCore> record;     // the usable record; null with errors
};

// `given` is the bundle directory or its Info.manifest. SDKs are read from
// `extensionPoints` (empty: the platform root's, RegistryLookup.h).
BundleLintResult lintBundle(const std::string& given, const std::string& extensionPoints);

}  // namespace tnctl
