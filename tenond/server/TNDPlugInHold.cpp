#include "tenond/server/TNDPlugInHold.h"

#include "platform/relay/KeepAlive.h"

namespace tnd {

TNDPlugInHold::TNDPlugInHold(const std::vector<tn::UUID>& plugIns, std::weak_ptr<TNDRelayClient> client,
                             std::optional<uid_t> onlyForUser)
    : uuid_(tn::UUID::random()),
      blocked_(plugIns.begin(), plugIns.end()),
      client_(std::move(client)),
      created_(tn::Date::now()),
      onlyForUser_(onlyForUser) {
  relay::transactionBegin();
}

TNDPlugInHold::~TNDPlugInHold() { relay::transactionEnd(); }

bool TNDPlugInHold::placedBy(const std::shared_ptr<TNDRelayClient>& client) const {
  return client && !client_.owner_before(client) && !client.owner_before(client_);
}

}  // namespace tnd
