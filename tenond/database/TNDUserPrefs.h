#pragma once

// TNDUserPrefs: the reader of the user's preferences domain
// "com.ostrel.tenon.userprefs". The daemon only reads it; other programs
// write it. Every call reads the domain afresh, so a value written by
// another process after start-up is seen by the next request.

#include <optional>
#include <sys/types.h>

#include "platform/prefs/PreferenceDomain.h"
#include "platform/value/Value.h"

namespace tnd {

class TNDUserPrefs {
 public:
  static constexpr const char* kDomain = "com.ostrel.tenon.userprefs";
  static constexpr const char* kExclusionsKey = "exclusions";

  // The domain of the daemon's own user.
  TNDUserPrefs();
  // The domain of `uid` (tests).
  explicit TNDUserPrefs(uid_t uid);

  // The stored "exclusions" value, unchanged, or none when absent. A domain
  // file that cannot be read is logged (naming the file) and gives none.
  std::optional<tn::Value> exclusions() const;

 private:
  prefs::PreferenceDomain domain_;
};

}  // namespace tnd
