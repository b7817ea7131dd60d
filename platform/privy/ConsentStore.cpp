#include "platform/privy/ConsentStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include <fmt/format.h>

#include "platform/codesign/DocumentCache.h"
#include "platform/codesign/TrustRule.h"
#include "platform/log/Log.h"
#include "platform/value/AtomicFile.h"
#include "platform/value/Document.h"
#include "platform/paths/InstancePaths.h"

namespace privy {
namespace {

constexpr const char* kLockName = ".consent.lock";

tn::Error privyError(PrivyErrorCode code, std::string message) {
  return tn::Error(std::string(kPrivyErrorDomain), static_cast<int64_t>(code), std::move(message));
}

// The document's records; entries that are not well-formed are skipped.
ConsentRecords recordsOf(const tn::Value& document) {
  ConsentRecords records;
  const tn::Dictionary* applications = document["applications"].dictionary();
  if (!applications) return records;
  for (const auto& [application, list] : *applications) {
    if (records.size() >= kMaxApplications) break;
    if (!isConsentIdentifier(application) || !list.isArray()) continue;
    std::vector<ConsentRecord> entries;
    for (const tn::Value& entry : *list.array()) {
      const std::string* service = entry["service"].string();
      if (!service || !isConsentIdentifier(*service) || entries.size() >= kMaxServicesPerApplication) continue;
      entries.push_back(ConsentRecord{*service, entry["granted"] == tn::Value(true)});
    }
    records.emplace_back(application, std::move(entries));
  }
  return records;
}

tn::Value documentOf(const ConsentRecords& records) {
  tn::Dictionary applications;
  for (const auto& [application, entries] : records) {
    tn::Array list;
    for (const ConsentRecord& entry : entries) {
      list.push_back(tn::Dictionary{{"service", entry.service}, {"granted", entry.granted}});
    }
    applications.set(application, std::move(list));
  }
  return tn::Dictionary{{"version", 1}, {"applications", std::move(applications)}};
}

// Root, or the owner of the store's directory (the daemon's user).
tn::Result<void> checkMayChange(const std::string& directory) {
  const uid_t caller = ::geteuid();
  if (caller == 0) return {};
  struct stat status {};
  if (::stat(directory.c_str(), &status) == 0 && status.st_uid == caller) return {};
  return privyError(PrivyErrorCode::NotPermitted,
                    "only root or the daemon's user can change consent; run tnctl consent as root");
}

// Makes the missing directories of path with mode 0755 whatever the umask:
// a directory writable by others would make the store untrusted.
tn::Result<void> makeDirectories(const std::filesystem::path& path) {
  std::filesystem::path partial;
  for (const std::filesystem::path& component : path) {
    partial /= component;
    if (::mkdir(partial.c_str(), 0755) == 0) {
      if (::chmod(partial.c_str(), 0755) != 0) break;
    } else if (errno != EEXIST) {
      break;
    }
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
    return privyError(PrivyErrorCode::WriteFailed, fmt::format("{}: cannot create: {}", path.string(), std::strerror(errno)));
  }
  return {};
}

// An exclusive lock on the store, held while the descriptor is open.
tn::Result<int> lockStore(const std::string& directory) {
  if (tn::Result<void> made = makeDirectories(directory); !made.ok()) return made.error();
  const std::string path = directory + "/" + kLockName;
  const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd < 0 || ::flock(fd, LOCK_EX) != 0) {
    const std::string reason = std::strerror(errno);
    if (fd >= 0) ::close(fd);
    return privyError(PrivyErrorCode::WriteFailed, fmt::format("{}: cannot lock: {}", path, reason));
  }
  return fd;
}

}  // namespace

bool isConsentIdentifier(std::string_view identifier) {
  if (identifier.empty() || identifier.size() > kMaxIdentifierLength) return false;
  return std::all_of(identifier.begin(), identifier.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' || c == '.' ||
           c == '_';
  });
}

std::string consentStorePath() {
  return paths::currentLayout().consentStore;
}

ConsentStore::ConsentStore(std::string path, uid_t trustedUser) : path_(std::move(path)), trustedUser_(trustedUser) {}

tn::Result<ConsentRecords> ConsentStore::read() const {
  const int fd = ::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) {
    if (errno == ENOENT) return ConsentRecords();
    return privyError(PrivyErrorCode::Unreadable, fmt::format("{}: cannot read: {}", path_, std::strerror(errno)));
  }
  tn::Result<void> trusted = codesign::checkTrustedFile(fd, trustedUser_);
  if (!trusted.ok()) {
    ::close(fd);
    return privyError(PrivyErrorCode::Untrusted,
                      fmt::format("{}: not trusted: {}", path_, trusted.error().localizedDescription()));
  }
  const codesign::DocumentCache::Parsed parsed = codesign::DocumentCache::shared().read(fd, path_);
  ::close(fd);
  if (!parsed->ok()) return privyError(PrivyErrorCode::Unreadable, parsed->error().localizedDescription());
  return recordsOf(parsed->value());
}

std::optional<std::vector<ConsentRecord>> ConsentStore::recordsForApplication(std::string_view bundleIdentifier) const {
  if (!isConsentIdentifier(bundleIdentifier)) return std::nullopt;
  tn::Result<ConsentRecords> records = read();
  if (!records.ok()) {
    TN_LOG_ERROR(tn::log::ops(), "consent store ignored, nothing is granted: {}",
                 records.error().localizedDescription());
    return std::vector<ConsentRecord>();
  }
  for (auto& [application, entries] : *records) {
    if (application == bundleIdentifier) return std::move(entries);
  }
  return std::vector<ConsentRecord>();
}

std::set<std::string> ConsentStore::allowedServices(std::string_view bundleIdentifier) const {
  std::set<std::string> services;
  for (const ConsentRecord& record : recordsForApplication(bundleIdentifier).value_or(std::vector<ConsentRecord>())) {
    if (record.granted) services.insert(record.service);
  }
  return services;
}

tn::Result<void> ConsentStore::setConsent(std::string_view bundleIdentifier, std::string_view service,
                                          bool granted) const {
  if (!isConsentIdentifier(bundleIdentifier) || !isConsentIdentifier(service)) {
    return privyError(PrivyErrorCode::InvalidArgument,
                      "application and service identifiers are 1 to 255 letters, digits and -._");
  }
  const std::string directory = std::filesystem::path(path_).parent_path().string();
  if (tn::Result<void> permitted = checkMayChange(directory); !permitted.ok()) return permitted;
  tn::Result<int> lock = lockStore(directory);
  if (!lock.ok()) return lock.error();
  struct Unlock {
    int fd;
    ~Unlock() { ::close(fd); }
  } unlock{*lock};

  tn::Result<ConsentRecords> records = read();
  if (!records.ok()) return records.error();
  auto application = std::find_if(records->begin(), records->end(),
                                  [&](const auto& entry) { return entry.first == bundleIdentifier; });
  if (application == records->end()) {
    if (records->size() >= kMaxApplications) return privyError(PrivyErrorCode::TooLarge, "too many applications");
    application = records->insert(records->end(), {std::string(bundleIdentifier), {}});
  }
  std::vector<ConsentRecord>& entries = application->second;
  auto entry = std::find_if(entries.begin(), entries.end(), [&](const ConsentRecord& r) { return r.service == service; });
  if (entry != entries.end()) {
    entry->granted = granted;
  } else if (entries.size() >= kMaxServicesPerApplication) {
    return privyError(PrivyErrorCode::TooLarge, "too many services for one application");
  } else {
    entries.push_back(ConsentRecord{std::string(service), granted});
  }
  tn::Result<std::string> text = tn::writeXmlDocument(documentOf(*records));
  if (!text.ok()) return privyError(PrivyErrorCode::WriteFailed, text.error().localizedDescription());
  tn::Result<void> written = tn::writeFileAtomically(path_, *text, 0644);
  if (!written.ok()) return privyError(PrivyErrorCode::WriteFailed, written.error().localizedDescription());
  return {};
}

}  // namespace privy
