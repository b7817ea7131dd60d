#pragma once

// PreferenceDomain: one user's preferences of one domain, stored as a
// structured-value document (a dictionary) at
//
//   $TENON_ROOT/var/lib/tenon/prefs/<uid>/<domain>.manifest
//
// Readers read the file afresh on every call, so a value written by another
// process at any time is seen by the next read; there is no cache to go
// stale and nothing to synchronise. Writers (tools, tests, the settings of
// other programs) replace the whole file atomically, one writer at a time
// per domain (an flock on "<domain>.manifest.lock" beside it), so that two
// writers of different keys do not lose each other's change.
//
// Temporary files that writers killed during a save left in a user's
// directory are removed when a writer writes there, and the first time this
// process reads a domain there (writers still alive keep theirs).
//
// A missing file or directory is an empty domain. A file that cannot be read
// or parsed, or whose root is not a dictionary, is an error naming the file;
// writing over such a file replaces it.

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace prefs {

// Errors of this layer: domain "Preferences".
inline constexpr std::string_view kPreferencesErrorDomain = "Preferences";
enum class PreferencesErrorCode : int64_t {
  InvalidDomain = 1,  // empty, or contains '/', or starts with '.'
  Unreadable = 2,     // the file exists but is not a readable document
  NotADictionary = 3, // the document's root is not a dictionary
  WriteFailed = 4,    // the directory, lock or atomic replace failed
};

class PreferenceDomain {
 public:
  // The domain `name` (e.g. "com.ostrel.tenon.userprefs") of user `uid`.
  PreferenceDomain(std::string name, uid_t uid);
  // ... of the calling process's real user.
  explicit PreferenceDomain(std::string name);

  const std::string& name() const { return name_; }
  // Where the domain is stored (under the current TENON_ROOT).
  std::string path() const;

  // The value under `key`, none when absent (or the domain is empty).
  tn::Result<std::optional<tn::Value>> value(std::string_view key) const;

  // Every key and value of the domain.
  tn::Result<tn::Dictionary> values() const;

  // Sets `key` to `value`, or removes it for none; creates the directories
  // (0700 for the user's) as needed.
  tn::Result<void> setValue(std::string_view key, const std::optional<tn::Value>& value) const;

 private:
  tn::Result<void> checkName() const;

  std::string name_;
  uid_t uid_;
};

}  // namespace prefs
