#include "tenond/database/TNDUserPrefs.h"

#include "platform/log/Log.h"

namespace tnd {

TNDUserPrefs::TNDUserPrefs() : domain_(kDomain) {}

TNDUserPrefs::TNDUserPrefs(uid_t uid) : domain_(kDomain, uid) {}

std::optional<tn::Value> TNDUserPrefs::exclusions() const {
  tn::Result<std::optional<tn::Value>> value = domain_.value(kExclusionsKey);
  if (!value.ok()) {
    TN_LOG_ERROR(tn::log::ops(), "unable to read the preference \"{}\": {}", kExclusionsKey,
                 value.error().localizedDescription());
    return std::nullopt;
  }
  return *value;
}

}  // namespace tnd
