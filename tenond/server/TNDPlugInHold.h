#pragma once

// A hold on plug-ins: while it is in force the daemon refuses to make the
// held plug-ins launchable and leaves them out of discovery. Each hold keeps
// the daemon from being idle (one unit of the relay keep-alive count) for its
// whole life.
//
// Reach: a hold placed by a privileged user (root, or a user named in
// tenond.manifest) holds the plug-ins for every user; one placed by anybody
// else holds them for that user's hosts only, so that one user cannot stop
// another's use of plug-ins (docs/holds.md).

#include <sys/types.h>

#include <memory>
#include <optional>
#include <unordered_set>
#include <vector>

#include "platform/value/Date.h"
#include "platform/value/UUID.h"

namespace tnd {

class TNDRelayClient;

class TNDPlugInHold {
 public:
  // A new hold with a fresh random token on the plug-ins named by their
  // UUIDs (duplicates collapse), placed by `client` (kept weakly), for the
  // hosts of `onlyForUser` (none: of every user).
  TNDPlugInHold(const std::vector<tn::UUID>& plugIns, std::weak_ptr<TNDRelayClient> client,
                std::optional<uid_t> onlyForUser = std::nullopt);
  ~TNDPlugInHold();

  TNDPlugInHold(const TNDPlugInHold&) = delete;
  TNDPlugInHold& operator=(const TNDPlugInHold&) = delete;

  const tn::UUID& uuid() const { return uuid_; }
  // True when the hold keeps `plugIn` from the hosts of `user`.
  bool blocks(const tn::UUID& plugIn, uid_t user) const { return reaches(user) && blocked_.count(plugIn) != 0; }
  bool reaches(uid_t user) const { return !onlyForUser_ || *onlyForUser_ == user; }
  const std::optional<uid_t>& onlyForUser() const { return onlyForUser_; }
  size_t blockedCount() const { return blocked_.size(); }
  const std::unordered_set<tn::UUID>& blocked() const { return blocked_; }
  // The client, or none once it has been destroyed.
  std::shared_ptr<TNDRelayClient> client() const { return client_.lock(); }
  // True when the hold was placed by this very client object (compared by
  // ownership, so a later client at the same address is never taken for it).
  bool placedBy(const std::shared_ptr<TNDRelayClient>& client) const;
  tn::Date created() const { return created_; }

  // Holds are equal when their tokens are.
  friend bool operator==(const TNDPlugInHold& a, const TNDPlugInHold& b) { return a.uuid_ == b.uuid_; }

 private:
  const tn::UUID uuid_;
  const std::unordered_set<tn::UUID> blocked_;
  const std::weak_ptr<TNDRelayClient> client_;
  const tn::Date created_;
  const std::optional<uid_t> onlyForUser_;
};

}  // namespace tnd
