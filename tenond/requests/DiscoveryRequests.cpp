// "match": the plug-ins a host may use for its rules and flags, as forms.
// "explain": why one plug-in is, or is not, among them, step by step.
// Both run the same Discovery (Discovery.h).

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/value/Cbor.h"
#include "platform/value/MessageValue.h"
#include "tenond/requests/Discovery.h"
#include "tenond/requests/ExecutableHost.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

std::string describeCandidates(const std::vector<PlugInPtr>& candidates) {
  std::string text = "(";
  for (const PlugInPtr& plugIn : candidates) {
    if (text.size() > 1) text += ", ";
    text += fmt::format("{}({}) {}", plugIn->identifierText(), plugIn->version().description(), plugIn->uuidText());
  }
  return text + ")";
}

std::string describeResults(const std::vector<Discovery::Offer>& offers) {
  std::string text = "(";
  for (const Discovery::Offer& offer : offers) {
    if (text.size() > 1) text += ", ";
    text += offer.plugIn->formUUID().description();
  }
  return text + ")";
}

// The typed encoding of the offered plug-ins' forms, an array: each form is
// spliced from what its record keeps, never built as a dictionary.
tn::Value encodedForms(const std::vector<Discovery::Offer>& offers) {
  tn::Bytes encoded;
  tn::appendCborArrayHead(encoded, offers.size());
  for (const Discovery::Offer& offer : offers) offer.plugIn->appendEncodedForm(encoded, offer.annotation, offer.marks);
  return tn::Value(std::move(encoded));
}

tn::Value verdictValue(const StepVerdict& verdict) {
  tn::Dictionary value{{"step", verdict.step}, {"passed", verdict.passed}, {"reason", verdict.reason}};
  if (!verdict.details.empty()) value.set("rules", tn::Value(verdict.details));
  return tn::Value(std::move(value));
}

}  // namespace

std::optional<Transaction::DiscoveryInput> Transaction::discoveryInput() {
  const tn::Value* rules = request().dictionary()->find("rules");
  if (rules != nullptr && !rules->isDictionary()) {
    fail(kErrorInvalidRequest, std::string("invalid request format (bad rules dictionary)"));
    return std::nullopt;
  }
  DiscoveryInput input;
  input.rules = rules != nullptr ? tn::convertMessageToMemory(*rules) : tn::Value();
  input.flags = relay_dictionary_get_uint64(request(), "flags").value_or(0);
  if ((input.flags & kDiscoverAll) != 0 && (!client_->mayManage() || client_->isSandboxed())) {
    fail(kErrorNotPermitted, std::string("unauthorized discovery flag (TNDiscoverAll)"));
    return std::nullopt;
  }
  return input;
}

Discovery Transaction::makeDiscovery(const DiscoveryInput& input, std::shared_ptr<const TNDHost> host, bool log) {
  Discovery::Request request;
  request.server = server();
  request.host = std::move(host);
  request.rules = input.rules;
  request.flags = input.flags;
  request.exclusions = server()->userPrefs().exclusions().value_or(tn::Value());
  request.annotation = [this](const TNDPlugIn& plugIn) { return annotationForForm(plugIn); };
  request.log = log;
  request.user = client_->peerIdentity().auditToken.uid;
  return Discovery(std::move(request));
}

void Transaction::matchPlugIns() {
  const std::optional<DiscoveryInput> input = discoveryInput();
  if (!input) return;
  Discovery discovery = makeDiscovery(*input, client_, true);
  std::vector<PlugInPtr> candidates = server()->findPlugIns(input->rules).value_or(std::vector<PlugInPtr>());
  TN_PROBE_DISCOVER_RAW(static_cast<unsigned>(candidates.size()));
  if (candidates.empty()) {
    TN_LOG_INFO(tn::log::ops(), "Candidate plugin count: 0");
  } else {
    TN_LOG_INFO(tn::log::ops(), "Candidate plugin count: {}, info: {}", candidates.size(),
                describeCandidates(candidates));
  }
  const std::vector<Discovery::Offer> results = discovery.run(std::move(candidates));
  if (results.empty()) {
    TN_LOG_INFO(tn::log::ops(), "Resulting plugin count: 0");
  } else {
    TN_LOG_INFO(tn::log::ops(), "Resulting plugin count: {}, UUIDs: {}", results.size(), describeResults(results));
  }
  if (version() == kCurrentProtocolVersion) reply().set("matches", encodedForms(results));
  TN_LOG_DEBUG(tn::log::ops(), "reply marshalled");
  done();
}

std::shared_ptr<const TNDHost> Transaction::explainedHost() {
  const std::string* path = relay_dictionary_get_string(request(), "host");
  if (path == nullptr) return client_;
  if (!client_->mayManage() || client_->isSandboxed()) {
    fail(kErrorNotPermitted, std::string("explaining for another host requires a manager"));
    return nullptr;
  }
  tn::Result<std::shared_ptr<ExecutableHost>> host = ExecutableHost::forExecutable(*path);
  if (!host) {
    fail(kErrorBadPath, host.error());
    return nullptr;
  }
  return *host;
}

std::shared_ptr<TNDPlugIn> Transaction::explainedPlugIn() {
  std::shared_ptr<TNDPlugIn> plugIn;
  if (const std::optional<tn::UUID> uuid = relay_dictionary_get_uuid(request(), "uuids")) {
    plugIn = server()->findPlugIn(*uuid);
  } else if (const std::string* path = relay_dictionary_get_string(request(), "paths")) {
    if (path->find('\0') == std::string::npos) plugIn = server()->findPlugInAtPath(tn::URL::fileURLWithPath(*path));
  }
  if (!plugIn) fail(kErrorNotFound, std::string("Cannot locate PlugIn"));
  return plugIn;
}

void Transaction::explainPlugIn() {
  const std::optional<DiscoveryInput> input = discoveryInput();
  if (!input) return;
  const std::shared_ptr<const TNDHost> host = explainedHost();
  if (!host) return;
  const std::shared_ptr<TNDPlugIn> plugIn = explainedPlugIn();
  if (!plugIn) return;

  Discovery discovery = makeDiscovery(*input, host, false);
  std::vector<PlugInPtr> candidates = server()->findPlugIns(input->rules).value_or(std::vector<PlugInPtr>());
  const bool candidate = std::any_of(candidates.begin(), candidates.end(),
                                     [&](const PlugInPtr& other) { return other->uuid() == plugIn->uuid(); });
  DiscoveryTrace trace;
  trace.subject = plugIn->uuid();
  discovery.run(std::move(candidates), &trace);

  tn::Array steps;
  steps.push_back(verdictValue(candidate ? StepVerdict{"registry", true, "the registry offers it for these rules", {}}
                                         : StepVerdict{"registry", false,
                                                       "the registry leaves it out for these rules (the user's "
                                                       "election, or a rule it can decide)", {}}));
  for (const StepVerdict& verdict : discovery.allSteps(*plugIn)) steps.push_back(verdictValue(verdict));
  // What only the run over every candidate knows: the host's own copies,
  // duplicates, replacement.
  for (const StepVerdict& verdict : trace.verdicts) {
    if (verdict.step == "bundle-relative preference" || verdict.step == "duplicates" || verdict.step == "export" ||
        verdict.step == "replacement") {
      steps.push_back(verdictValue(verdict));
    }
  }
  tn::Dictionary explanation{{"plugin", plugIn->uuid() ? tn::Value(plugIn->uuid()->string()) : tn::Value()},
                             {"identifier", tn::Value(plugIn->identifier().value_or(""))},
                             {"path", tn::Value(plugIn->path().value_or(""))},
                             {"host", tn::Value(host->executablePath())},
                             {"offered", tn::Value(trace.offered)},
                             {"steps", tn::Value(std::move(steps))}};
  reply().set("explanation", tn::convertMemoryToMessage(tn::Value(std::move(explanation))));
  done();
}

}  // namespace tnd
