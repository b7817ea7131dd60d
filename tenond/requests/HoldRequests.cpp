// "lock": puts plug-ins on hold, or releases holds.
//
// The release form (`uuids`) ends each hold whose token it names; the token
// alone decides, and an unknown token is no error. The hold form (`paths`,
// `flags`) collects the plug-ins of applications (or, with
// TNHoldPlugInPaths, the plug-ins at the paths), refuses with their busy
// reports when TNHoldUnlessBusy finds any busy, then places the hold and,
// with TNHoldTerminate, terminates their running instances before it
// answers. The hold is in force before the first termination is asked for,
// so a host cannot start an instance again in between.
//
// Reach (docs/holds.md): a privileged user's hold and termination apply to
// every user; anybody else's to that user's hosts and instances only.

#include <fmt/format.h>

#include <optional>
#include <vector>

#include "platform/log/Escape.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/plugin/TNDPlugIn.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/PlugInTermination.h"
#include "tenond/server/TNDPlugInHold.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

enum : uint64_t {
  kHoldPlugInPaths = 0x1,
  kHoldUnlessBusy = 0x2,
  kHoldTerminate = 0x4,
};

using PlugInList = std::vector<std::shared_ptr<TNDPlugIn>>;

std::string describe(const PlugInList& plugIns) {
  std::string text = "[";
  for (const std::shared_ptr<TNDPlugIn>& plugIn : plugIns) {
    if (text.size() > 1) text += ", ";
    text += plugIn->identifierText() + "(" + plugIn->uuidText() + ")";
  }
  return text + "]";
}

}  // namespace

void Transaction::lockDownPlugIns() {
  if (const tn::Array* tokens = relay_dictionary_get_array(request(), "uuids")) {
    for (const tn::Value& token : *tokens)
      if (const std::optional<tn::UUID> uuid = token.uuid()) server()->unholdToken(*uuid);
    done();
    return;
  }
  const uint64_t flags = relay_dictionary_get_uint64(request(), "flags").value_or(0);
  const std::optional<PlugInList> plugIns = plugInsToHold(flags);
  if (!plugIns) return;
  TN_LOG_INFO(tn::log::ops(), "processing hold request for plug-ins:{}", describe(*plugIns));
  if ((flags & kHoldUnlessBusy) && refuseWhenBusy(*plugIns)) return;

  std::vector<tn::UUID> blocked;
  for (const std::shared_ptr<TNDPlugIn>& plugIn : *plugIns)
    if (plugIn->uuid()) blocked.push_back(*plugIn->uuid());
  const auto hold = std::make_shared<TNDPlugInHold>(blocked, client_, holdReach());
  if (!server()->addHold(hold)) {
    fail(kErrorNotPermitted, fmt::format("hold refused: this connection already has {} holds; release one first",
                                         TNDServer::kHoldsPerClient));
    return;
  }
  const std::string token = hold->uuid().string();
  reply().set("uuids", hold->uuid());
  if (flags & kHoldTerminate) {
    registrar::PlugInList records;
    for (const std::shared_ptr<TNDPlugIn>& plugIn : *plugIns)
      if (registrar::PlugInPtr record = plugIn->getProxy()) records.push_back(std::move(record));
    // The reply waits for every answer; this transaction stays alive in
    // the completion, and its request's budget stays charged until then.
    server()->terminatePlugIns(
        records,
        [self = shared_from_this(), token] {
          TN_LOG_INFO(tn::log::ops(), "forced termination complete; hold request granted uuid:{}", token);
          self->done();
        },
        holdReach());
    return;
  }
  TN_LOG_INFO(tn::log::ops(), "hold request granted uuid:{}", token);
  done();
}

std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> Transaction::plugInsToHold(uint64_t flags) {
  PlugInList plugIns;
  const bool walked = marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      fail(kErrorBadPath, fmt::format("invalid path: {}", tn::log::escapeText(path)));
      return false;
    }
    const tn::URL url = tn::URL::fileURLWithPath(path);
    if (flags & kHoldPlugInPaths) {
      std::shared_ptr<TNDPlugIn> plugIn = server()->findPlugInAtPath(url);
      if (!plugIn) {
        fail(kErrorBadPath, fmt::format("no plug-in at path:{}", tn::log::escapeText(path)));
        return false;
      }
      plugIns.push_back(std::move(plugIn));
      return true;
    }
    if (auto within = server()->plugInsWithinApplication(url))
      plugIns.insert(plugIns.end(), std::make_move_iterator(within->begin()), std::make_move_iterator(within->end()));
    return true;
  });
  if (!walked) return std::nullopt;
  return plugIns;
}

bool Transaction::refuseWhenBusy(const std::vector<std::shared_ptr<TNDPlugIn>>& plugIns) {
  const std::shared_ptr<vigil::Vigil> busyService = server()->vigil();
  const auto busyInstances = [&busyService](const std::set<std::string>& identifiers) {
    return busyService ? busyService->busyInstances(identifiers) : std::vector<tn::Value>{};
  };
  tn::Array conflicts;
  PlugInList busy;
  for (const std::shared_ptr<TNDPlugIn>& plugIn : plugIns) {
    if (std::optional<tn::Value> report = plugIn->checkBusy(busyInstances)) {
      busy.push_back(plugIn);
      conflicts.push_back(std::move(*report));
    }
  }
  if (busy.empty()) return false;
  TN_LOG_DEBUG(tn::log::ops(), "hold refused. Busy plug-ins:{}", describe(busy));
  reply().set("conflicts", tn::convertMemoryToMessage(tn::Value(std::move(conflicts))));
  fail(kErrorBusy, std::string("plug-ins are busy"));
  return true;
}

std::optional<uid_t> Transaction::holdReach() const {
  if (client_->isPrivilegedUser()) return std::nullopt;
  return client_->peerIdentity().auditToken.uid;
}

}  // namespace tnd
