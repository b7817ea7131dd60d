#include "tenond/requests/Discovery.h"

#include <algorithm>

#include <fmt/format.h>

#include "libtenon/model/VersionComparison.h"
#include "platform/log/Log.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

StepVerdict pass(std::string step, std::string reason) { return StepVerdict{std::move(step), true, std::move(reason), {}}; }
StepVerdict refuse(std::string step, std::string reason) {
  return StepVerdict{std::move(step), false, std::move(reason), {}};
}

// A version as the comparison takes it: a string, or none.
std::optional<std::string> versionText(const tn::Value& version) {
  if (const std::string* text = version.string()) return *text;
  return std::nullopt;
}

}  // namespace

Discovery::Discovery(Request request)
    : server_(std::move(request.server)),
      host_(std::move(request.host)),
      rules_(std::move(request.rules)),
      flags_(request.flags),
      exclusions_(std::move(request.exclusions)),
      annotation_(std::move(request.annotation)),
      log_(request.log),
      context_(TNDMatchContext::current()),
      held_(server_->heldPlugIns(request.user)) {
  if (const std::shared_ptr<tn::TNBundle> bundle = host_->bundle()) plugInsPath_ = bundle->plugInsPath();
}

std::vector<PlugInPtr> Discovery::preferBundleRelative(std::vector<PlugInPtr> candidates,
                                                       DiscoveryTrace* trace) const {
  const std::string executable = host_->executablePath();
  if (executable.empty()) {
    if (log_) TN_LOG_ERROR(tn::log::ops(), "Failed to determine path for pid {}, {}", hostPid(), ENOENT);
    return candidates;
  }
  // The host's own copy of each identifier: the last candidate, in order,
  // whose containing application holds the host's executable.
  std::unordered_map<std::string, const TNDPlugIn*> own;
  for (const PlugInPtr& candidate : candidates) {
    const std::optional<std::string> containing = candidate->containingPath();
    if (containing && executable.starts_with(*containing) && candidate->identifier()) {
      own[*candidate->identifier()] = candidate.get();
    }
  }
  std::vector<PlugInPtr> kept;
  for (PlugInPtr& candidate : candidates) {
    const auto found = candidate->identifier() ? own.find(*candidate->identifier()) : own.end();
    if (found == own.end() || found->second == candidate.get()) {
      kept.push_back(std::move(candidate));
      continue;
    }
    const std::string preferred = found->second->path().value_or("");
    if (log_) {
      TN_LOG_INFO(tn::log::ops(), "Ignoring {} @ '{}' in favor of bundle-relative '{}'", candidate->uuidText(),
                  candidate->path().value_or(""), preferred);
    }
    if (trace && candidate->uuid() == trace->subject) {
      trace->verdicts.push_back(refuse("bundle-relative preference",
                                       fmt::format("the host carries its own copy of {} at {}",
                                                   candidate->identifier().value_or(""), preferred)));
    }
  }
  return kept;
}

StepVerdict Discovery::location(const TNDPlugIn& plugIn) const {
  if (plugIn.onSystemVolume()) return pass("location", "on the system volume");
  if (!plugIn.containingUrl()) return refuse("location", "neither on the system volume nor inside an application");
  if ((flags_ & kDiscoverSystemOnly) != 0) {
    return refuse("location", "not on the system volume, and the host asked for system plug-ins only");
  }
  return pass("location", "inside the application " + plugIn.containingPath().value_or(""));
}

StepVerdict Discovery::dedication(const TNDPlugIn& plugIn) const {
  if (!plugIn.isDedicated()) return pass("dedication", "not dedicated to one host");
  if (!plugInsPath_) return refuse("dedication", "dedicated to the application that holds it; the host is in no bundle");
  if (plugIn.path().value_or("").starts_with(*plugInsPath_)) {
    return pass("dedication", "dedicated to this host, whose PlugIns directory holds it");
  }
  return refuse("dedication", "dedicated to the application that holds it, not to this host");
}

StepVerdict Discovery::hold(const TNDPlugIn& plugIn) const {
  if (plugIn.uuid() && held_.contains(*plugIn.uuid())) return refuse("hold", "a hold blocks it");
  return pass("hold", "no hold blocks it");
}

StepVerdict Discovery::rules(const TNDPlugIn& plugIn) const {
  StepVerdict verdict = pass("rules", "it matches every rule");
  const tn::Dictionary* entries = rules_.dictionary();
  if (entries == nullptr || entries->empty()) {
    verdict.reason = "no rules";
    return verdict;
  }
  for (const auto& [key, pattern] : *entries) {
    const bool matched = plugIn.matchKey(key, pattern, context_);
    verdict.details.push_back(tn::Value(tn::Dictionary{{"key", key}, {"pattern", pattern}, {"passed", matched}}));
    if (!matched && verdict.passed) {
      verdict.passed = false;
      verdict.reason = fmt::format("it does not match the rule {}: {}", key, pattern.description());
    }
  }
  // The run's own answer decides (it also bounds the work of the whole
  // dictionary, which entry by entry does not see).
  if (verdict.passed && !plugIn.match(rules_, context_)) {
    verdict.passed = false;
    verdict.reason = "the rules as a whole are too large to evaluate";
  }
  return verdict;
}

StepVerdict Discovery::exclusions(const TNDPlugIn& plugIn) const {
  const tn::Array* list = exclusions_.array();
  if (list == nullptr) return pass("exclusions", "the user excludes nothing");
  for (const tn::Value& exclusion : *list) {
    if (plugIn.match(exclusion, context_)) {
      return refuse("exclusions", "the user excludes it: " + exclusion.description());
    }
  }
  return pass("exclusions", "no exclusion of the user matches it");
}

StepVerdict Discovery::hostAuthorization(const TNDPlugIn& plugIn) const {
  if (const std::optional<std::string> reason = plugIn.allowForClient(*host_, context_)) {
    return refuse("host authorization", *reason);
  }
  return pass("host authorization", "the host may use it");
}

std::vector<StepVerdict> Discovery::allSteps(const TNDPlugIn& plugIn) const {
  std::vector<StepVerdict> steps;
  if (discoverAll()) {
    steps.push_back(pass("location", "not checked: the host discovers all"));
    steps.push_back(pass("dedication", "not checked: the host discovers all"));
    steps.push_back(pass("hold", "not checked: the host discovers all"));
  } else {
    steps.push_back(location(plugIn));
    steps.push_back(dedication(plugIn));
    steps.push_back(hold(plugIn));
  }
  steps.push_back(rules(plugIn));
  steps.push_back(exclusions(plugIn));
  steps.push_back(discoverAll() ? pass("host authorization", "not checked: the host discovers all")
                                : hostAuthorization(plugIn));
  return steps;
}

std::optional<StepVerdict> Discovery::firstRefusal(const TNDPlugIn& plugIn) const {
  if (!discoverAll()) {
    for (StepVerdict verdict : {location(plugIn), dedication(plugIn), hold(plugIn)}) {
      if (!verdict.passed) return verdict;
    }
  }
  if (!plugIn.match(rules_, context_)) return refuse("rules", "it does not match the rules");
  if (StepVerdict excluded = exclusions(plugIn); !excluded.passed) {
    if (log_) TN_LOG_INFO(tn::log::ops(), "client {} plugin {} globally excluded", hostPid(), plugIn.uuidText());
    return excluded;
  }
  if (!discoverAll()) {
    if (StepVerdict allowed = hostAuthorization(plugIn); !allowed.passed) {
      if (log_) {
        TN_LOG_INFO(tn::log::ops(), "client {} cannot use plugin {}: {}", hostPid(), plugIn.uuidText(),
                    allowed.reason);
      }
      return allowed;
    }
  }
  return std::nullopt;
}

std::vector<Discovery::Offer> Discovery::run(std::vector<PlugInPtr> candidates, DiscoveryTrace* trace) {
  std::vector<Result> results;
  // Where the results of each identifier are, so that duplicate reduction
  // looks only at those (a registry of thousands must not cost a square).
  std::unordered_map<std::optional<std::string>, std::vector<std::size_t>, IdentifierHash> byIdentifier;
  for (const PlugInPtr& candidate : preferBundleRelative(std::move(candidates), trace)) {
    const bool traced = trace && candidate->uuid() == trace->subject;
    if (std::optional<StepVerdict> refusal = firstRefusal(*candidate)) {
      if (traced) trace->verdicts.push_back(std::move(*refusal));
      continue;
    }
    if (const std::optional<tn::Error> unexported = candidate->exportError()) {
      if (log_) {
        TN_LOG_ERROR(tn::log::ops(), "failed to export matching plug-in {}: {}", candidate->uuidText(),
                     unexported->description());
      }
      if (traced) trace->verdicts.push_back(refuse("export", unexported->localizedDescription()));
      continue;
    }
    std::optional<std::string> identifier = candidate->identifier();
    std::vector<std::size_t>& sameIdentifier = byIdentifier[identifier];
    if (!reduceDuplicates(*candidate, results, sameIdentifier, trace)) continue;
    sameIdentifier.push_back(results.size());
    results.push_back(Result{Offer{candidate, annotation_(*candidate), {}}, std::move(identifier)});
  }
  markReplacements(results, trace);
  std::vector<Offer> offers;
  offers.reserve(results.size());
  for (Result& result : results) {
    if (result.dropped) continue;
    if (trace && result.offer.plugIn->uuid() == trace->subject) trace->offered = true;
    offers.push_back(std::move(result.offer));
  }
  return offers;
}

bool Discovery::reduceDuplicates(const TNDPlugIn& plugIn, std::vector<Result>& results,
                                 const std::vector<std::size_t>& sameIdentifier, DiscoveryTrace* trace) const {
  const bool allVersions = (flags_ & kDiscoverAllVersions) != 0;
  if (allVersions && (flags_ & kDiscoverDuplicates) != 0) return true;
  const std::optional<std::string> mine = versionText(plugIn.version());
  const bool traced = trace && plugIn.uuid() == trace->subject;
  for (const std::size_t position : sameIdentifier) {
    Result& earlier = results[position];
    if (earlier.dropped) continue;
    const TNDPlugIn& earlierPlugIn = *earlier.offer.plugIn;
    const std::optional<std::string> theirs = versionText(earlierPlugIn.formVersion());
    const int order = mine && theirs ? tn::compareVersionString(*mine, *theirs) : 0;
    if (order != 0 && allVersions) continue;  // another version: both stay
    const bool wins = order > 0 || (order == 0 && preferredOver(plugIn, earlierPlugIn));
    const std::string other = earlierPlugIn.uuidText();
    if (traced) {
      trace->verdicts.push_back(wins ? pass("duplicates", "preferred to " + other + ", which it replaces")
                                     : refuse("duplicates", "another copy is preferred: " + other));
    } else if (trace && earlierPlugIn.uuid() == trace->subject && wins) {
      trace->verdicts.push_back(refuse("duplicates", "another copy is preferred: " + plugIn.uuidText()));
    }
    if (!wins) return false;
    earlier.dropped = true;
    return true;
  }
  if (traced) trace->verdicts.push_back(pass("duplicates", "no other copy of its identifier was offered before it"));
  return true;
}

bool Discovery::preferredOver(const TNDPlugIn& plugIn, const TNDPlugIn& theirs) const {
  if (!plugIn.onSystemVolume() && theirs.onSystemVolume()) return false;
  if (plugIn.onSystemVolume() && !theirs.onSystemVolume()) return true;
  return plugIn.lastModified() > theirs.lastModified();
}

void Discovery::markReplacements(std::vector<Result>& results, DiscoveryTrace* trace) const {
  // Who replaces whom, by identifier: a later declaration of the same
  // identifier wins.
  std::unordered_map<std::string, Result*> replacements;
  for (Result& result : results) {
    if (result.dropped) continue;
    const tn::Value declared = result.offer.plugIn->valueForEntitlement(TNDPlugIn::kReplacePlugInEntitlement);
    if (const std::string* one = declared.string()) replacements[*one] = &result;
    if (const tn::Array* many = declared.array()) {
      for (const tn::Value& element : *many) {
        if (const std::string* identifier = element.string()) replacements[*identifier] = &result;
      }
    }
  }
  if (replacements.empty()) return;
  for (Result& result : results) {
    if (result.dropped) continue;
    const std::optional<std::string>& identifier = result.identifier;
    const auto found = identifier ? replacements.find(*identifier) : replacements.end();
    if (found == replacements.end()) continue;
    Result& overrider = *found->second;
    const tn::Value overriderUUID = overrider.offer.plugIn->formUUID();
    result.offer.marks.set("overrider", overriderUUID);
    overrider.offer.marks.set("overriding", tn::Value(*identifier));
    if (log_) {
      TN_LOG_INFO(tn::log::ops(), "plug-in {} overrides {}", overriderUUID.description(),
                  result.offer.plugIn->formUUID().description());
    }
    if (trace && result.offer.plugIn->uuid() == trace->subject) {
      trace->verdicts.push_back(
          pass("replacement", "replaced by " + overrider.offer.plugIn->uuidText() + " (overrider)"));
    }
    if (trace && overrider.offer.plugIn->uuid() == trace->subject) {
      trace->verdicts.push_back(pass("replacement", "replaces " + *identifier + " (overriding)"));
    }
  }
}

}  // namespace tnd
