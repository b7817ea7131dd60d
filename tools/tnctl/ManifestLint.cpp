#include "tools/tnctl/ManifestLint.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "platform/activation/ActivationRule.h"
#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "tools/tnctl/ManifestSchema.h"
#include "tools/tnctl/Spelling.h"

namespace tnctl {
namespace {

using Severity = LintFinding::Severity;

LintFinding errorFinding(std::string message) { return {Severity::Error, std::move(message)}; }
LintFinding warningFinding(std::string message) { return {Severity::Warning, std::move(message)}; }

const KnownKey* findKnown(std::string_view key, KeyPlace place) {
  for (const KnownKey& known : knownKeys()) {
    if (known.key == key && known.place == place) return &known;
  }
  return nullptr;
}

// A known key of another place, written here by mistake.
const KnownKey* knownElsewhere(std::string_view key, KeyPlace place) {
  for (const KnownKey& known : knownKeys()) {
    if (known.key == key && known.place != place) return &known;
  }
  return nullptr;
}

std::optional<LintFinding> checkUnknownKey(const std::string& key, KeyPlace place) {
  if (const KnownKey* other = knownElsewhere(key, place)) {
    return errorFinding(fmt::format("\"{}\" belongs in {}, not in {}", key, placeName(other->place), placeName(place)));
  }
  if (std::optional<std::string> meant = likelyIntended(key, knownKeyNames(place))) {
    return errorFinding(fmt::format("unknown key \"{}\" in {}; did you mean \"{}\"?", key, placeName(place), *meant));
  }
  // The author's own attributes are for hosts' rules; other unknown keys
  // are read by nobody here, which may be intended (the plug-in's own).
  if (place == KeyPlace::Attributes) return std::nullopt;
  return warningFinding(fmt::format("unknown key \"{}\" in {} is not read by the system", key, placeName(place)));
}

void checkKind(const KnownKey& known, const tn::Value& value, std::vector<LintFinding>& findings) {
  if (known.kind == ValueKind::Rule) {
    if (std::string problem = activation::ruleProblem(value); !problem.empty()) {
      findings.push_back(errorFinding(fmt::format("\"{}\" is not a valid activation rule: {}", known.key, problem)));
    }
    return;
  }
  if (!hasKind(value, known.kind)) {
    findings.push_back(errorFinding(fmt::format("\"{}\" in {} has the wrong type: {} where {} is needed", known.key,
                                         placeName(known.place), valueKindName(value), kindName(known.kind))));
  }
}

// The author's own attributes: what a host's rule can match. Rules compare
// strings (or arrays of them), test flags and numbers, and evaluate
// dictionaries as activation rules; anything else would be skipped
// silently when matching.
void checkAuthorAttribute(const std::string& key, const tn::Value& value, std::vector<LintFinding>& findings) {
  const std::string where = fmt::format("attribute \"{}\"", key);
  if (value.isString() || value.numberAsDouble() || value.boolean()) return;
  if (const tn::Array* elements = value.array()) {
    for (size_t i = 0; i < elements->size(); ++i) {
      if (!(*elements)[i].isString()) {
        findings.push_back(errorFinding(fmt::format("{} has {} at index {}: rules match only the strings of an array",
                                             where, valueKindName((*elements)[i]), i)));
        return;
      }
    }
    return;
  }
  if (value.isDictionary()) {
    if (std::string problem = activation::ruleProblem(value); !problem.empty()) {
      findings.push_back(errorFinding(fmt::format("{} is a dictionary but not a valid activation rule: {}", where, problem)));
    }
    return;
  }
  findings.push_back(errorFinding(fmt::format("{} is {}, which no rule can match (strings, numbers, booleans, arrays of "
                                       "strings and activation rules can be matched)",
                                       where, valueKindName(value))));
}

void checkPlace(const tn::Dictionary& entries, KeyPlace place, std::vector<LintFinding>& findings) {
  for (const auto& [key, value] : entries) {
    if (const KnownKey* known = findKnown(key, place)) {
      checkKind(*known, value, findings);
      continue;
    }
    if (std::optional<LintFinding> unknown = checkUnknownKey(key, place)) findings.push_back(std::move(*unknown));
    if (place == KeyPlace::Attributes) checkAuthorAttribute(key, value, findings);
  }
}

}  // namespace

std::vector<LintFinding> checkManifestKeys(const tn::Value& info) {
  std::vector<LintFinding> findings;
  if (const tn::Dictionary* top = info.dictionary()) checkPlace(*top, KeyPlace::Info, findings);
  const tn::Value& plugIn = info[tn::keys::kXTExtension];
  if (const tn::Dictionary* entries = plugIn.dictionary()) checkPlace(*entries, KeyPlace::PlugIn, findings);
  if (const tn::Dictionary* attributes = plugIn[tn::keys::kAttributes].dictionary()) {
    checkPlace(*attributes, KeyPlace::Attributes, findings);
  }
  return findings;
}

std::optional<LintFinding> checkExtensionPoint(const tn::Value& info, const tn::TNRegistryLookup& registry) {
  const std::string* point = info[tn::keys::kXTExtension][tn::keys::kExtensionPointIdentifier].string();
  if (point == nullptr || registry.sdkDictionary(*point)) return std::nullopt;
  return errorFinding(fmt::format("extension point \"{}\" (\"{}\") is not registered; --extension-points DIR names "
                           "where its definition is",
                           *point, tn::keys::kExtensionPointIdentifier));
}

std::optional<LintFinding> checkExecutable(const std::string& bundlePath, const tn::Value& info) {
  const std::string_view key = bundle::kBundleExecutableKey;
  const tn::Value& named = info[key];
  if (named.isNull()) {
    return errorFinding(fmt::format("missing \"{}\" key: a plug-in that is not data-only (protocol \"{}\") needs an "
                             "executable in {}/",
                             key, tn::keys::kDataProtocol, bundle::kExecutableDirectoryName));
  }
  const std::string* name = named.string();
  if (name == nullptr) return std::nullopt;  // its kind is reported by checkManifestKeys
  if (!bundle::isPlainFileName(*name)) {
    return errorFinding(fmt::format("\"{}\" must be a plain file name in {}/, not \"{}\"", key,
                             bundle::kExecutableDirectoryName, *name));
  }
  const std::string relative = fmt::format("{}/{}", bundle::kExecutableDirectoryName, *name);
  const std::string path = bundle::joinPath(bundlePath, relative);
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    return errorFinding(fmt::format("the executable {} named by \"{}\" does not exist", relative, key));
  }
  if (!S_ISREG(status.st_mode)) return errorFinding(fmt::format("the executable {} is not a regular file", relative));
  if (::access(path.c_str(), X_OK) != 0) {
    return errorFinding(fmt::format("the executable {} is not executable (mode {:04o})", relative, status.st_mode & 07777));
  }
  return std::nullopt;
}

bool hasErrors(const std::vector<LintFinding>& findings) {
  return std::ranges::any_of(findings, [](const LintFinding& f) { return f.severity == Severity::Error; });
}

}  // namespace tnctl
