#pragma once

// platform/privy: the consent store (library tn_privy), this system's
// record of which privacy services (camera, microphone, contacts, ...) the
// user granted to each application.
//
// One structured-value document, $TENON_ROOT/var/lib/tenon/consent.manifest:
//
//   {"version": 1,
//    "applications": {
//      "com.example.photos": [{"service": "com.ostrel.privy.camera", "granted": true},
//                             {"service": "com.ostrel.privy.location", "granted": false}]}}
//
// keyed by the application's bundle identifier. Consent belongs to the
// application: all plug-ins of one application share its grants.
//
// Reading (the daemon): the file counts only when it passes the trust rule
// (codesign/TrustRule.h: owned by root or the daemon's user, not writable by
// others, nor any directory above it). An untrusted or malformed file is
// logged (error, "ops") and read as empty, so nothing is granted; a missing
// file is simply empty. Parsed files are cached while unchanged.
//
// Changing (tnctl consent): only root or the daemon's user, the owner of
// $TENON_ROOT/var/lib/tenon; the change is made under an exclusive lock
// (flock on .consent.lock beside the file) and written atomically with mode
// 0644. docs/consent.md describes the file and the command.

#include <sys/types.h>
#include <unistd.h>

#include <cstddef>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace privy {

inline constexpr std::string_view kPrivyErrorDomain = "Privy";

enum class PrivyErrorCode : int64_t {
  NotPermitted = 1,     // the caller may not change consent
  Untrusted = 2,        // the store fails the trust rule
  Unreadable = 3,       // the store cannot be read or parsed
  InvalidArgument = 4,  // not an application or service identifier
  TooLarge = 5,         // the change would exceed a bound
  WriteFailed = 6,      // the store or its lock could not be written
};

// Application and service identifiers: 1 to 255 letters, digits and -._
inline constexpr size_t kMaxIdentifierLength = 255;
inline constexpr size_t kMaxApplications = 4096;
inline constexpr size_t kMaxServicesPerApplication = 256;

bool isConsentIdentifier(std::string_view identifier);

struct ConsentRecord {
  std::string service;
  bool granted = false;
  friend bool operator==(const ConsentRecord&, const ConsentRecord&) = default;
};

// Application identifier to its records, in the file's order.
using ConsentRecords = std::vector<std::pair<std::string, std::vector<ConsentRecord>>>;

// $TENON_ROOT/var/lib/tenon/consent.manifest, read when called.
std::string consentStorePath();

class ConsentStore {
 public:
  // The store at path; files owned by trustedUser (besides root) are
  // trusted. Nothing is read until asked.
  explicit ConsentStore(std::string path = consentStorePath(), uid_t trustedUser = ::geteuid());

  const std::string& path() const { return path_; }

  // --- The daemon's questions: never fail, log what goes wrong. ---

  // The application's records; none when bundleIdentifier is not an
  // application identifier. Empty when the store is missing, untrusted or
  // malformed, or knows nothing of the application.
  std::optional<std::vector<ConsentRecord>> recordsForApplication(std::string_view bundleIdentifier) const;
  // The services granted to the application (records whose "granted" is
  // true).
  std::set<std::string> allowedServices(std::string_view bundleIdentifier) const;

  // --- tnctl's: errors as values. ---

  // Every application's records, as the daemon would read them; Untrusted
  // or Unreadable instead of logging.
  tn::Result<ConsentRecords> read() const;
  // Records the user's decision for one service of one application
  // (replacing an earlier one). NotPermitted unless the caller is root or
  // the owner of the store's directory.
  tn::Result<void> setConsent(std::string_view bundleIdentifier, std::string_view service, bool granted) const;

 private:
  std::string path_;
  uid_t trustedUser_;
};

}  // namespace privy
