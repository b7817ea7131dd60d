#pragma once

// What lint finds in a plug-in bundle, beyond the record's own diagnosis:
// keys of the wrong kind, unknown and misspelled keys, attributes no rule
// could use, an extension point that is not registered, a missing or
// non-executable executable. Each finding names the key the author wrote.

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "libtenon/model/TNRegistryLookup.h"
#include "platform/value/Value.h"

namespace tnctl {

struct LintFinding {
  enum class Severity { Error, Warning };
  Severity severity = Severity::Error;
  std::string message;
};

// The kinds and names of the keys of `info` (the bundle's Info.manifest)
// and of its plug-in dictionary and attributes, before any SDK is merged:
// so that a finding is about what the author wrote.
std::vector<LintFinding> checkManifestKeys(const tn::Value& info);

// An extension point named by the plug-in that `registry` does not know.
std::optional<LintFinding> checkExtensionPoint(const tn::Value& info, const tn::TNRegistryLookup& registry);

// The executable of a plug-in that is not data-only: "BNBundleExecutable"
// must name a regular, executable file in the bundle's bin/.
std::optional<LintFinding> checkExecutable(const std::string& bundlePath, const tn::Value& info);

bool hasErrors(const std::vector<LintFinding>& findings);

}  // namespace tnctl
