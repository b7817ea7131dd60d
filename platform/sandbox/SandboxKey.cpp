#include "platform/sandbox/SandboxKey.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>

#include <fmt/format.h>
#include <openssl/rand.h>

#include "platform/value/AtomicFile.h"
#include "platform/paths/InstancePaths.h"

namespace sandbox {
namespace {

tn::Error keyError(const std::string& path, std::string_view what, int error) {
  return tn::Error(std::string(kSandboxErrorDomain), error, fmt::format("{}: {}: {}", path, what, std::strerror(error)));
}

struct CachedKey {
  dev_t device = 0;
  ino_t inode = 0;
  SandboxKey key{};
};

// Keys already read, by path: issuing a token must not cost a file read.
std::mutex cacheMutex;
std::map<std::string, CachedKey> cache;  // guarded by cacheMutex

std::optional<SandboxKey> cachedKey(const std::string& path, const struct stat& status) {
  const std::lock_guard lock(cacheMutex);
  const auto found = cache.find(path);
  if (found == cache.end() || found->second.device != status.st_dev || found->second.inode != status.st_ino) {
    return std::nullopt;
  }
  return found->second.key;
}

void rememberKey(const std::string& path, const struct stat& status, const SandboxKey& key) {
  const std::lock_guard lock(cacheMutex);
  cache[path] = CachedKey{status.st_dev, status.st_ino, key};
}

// The keys this process issues with, by path, kept from the first read or
// creation on: issuing a token costs no file-system work. Replacing the key
// file under a running issuer is therefore not seen by it (docs/sandbox-tokens.md).
std::map<std::string, SandboxKey, std::less<>> issuingKeys;  // guarded by cacheMutex

std::optional<SandboxKey> keptIssuingKey(const std::string& path) {
  const std::lock_guard lock(cacheMutex);
  const auto found = issuingKeys.find(path);
  if (found == issuingKeys.end()) return std::nullopt;
  return found->second;
}

SandboxKey keepIssuingKey(const std::string& path, const SandboxKey& key) {
  const std::lock_guard lock(cacheMutex);
  return issuingKeys.try_emplace(path, key).first->second;
}

// Reads the key file at path, which must be a regular file of exactly the
// key's size.
tn::Result<SandboxKey> readKeyFile(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) == 0) {
    if (std::optional<SandboxKey> known = cachedKey(path, status)) return *known;
  }
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) return keyError(path, "cannot open", errno);
  SandboxKey key{};
  ssize_t got = -1;
  int error = 0;
  if (::fstat(fd, &status) != 0) {
    error = errno;
  } else if (!S_ISREG(status.st_mode) || status.st_size != static_cast<off_t>(key.size())) {
    error = EINVAL;
  } else {
    do got = ::read(fd, key.data(), key.size());
    while (got < 0 && errno == EINTR);
    if (got != static_cast<ssize_t>(key.size())) error = got < 0 ? errno : EINVAL;
  }
  ::close(fd);
  if (error == EINVAL) return keyError(path, "not a key file of 32 bytes", error);
  if (error != 0) return keyError(path, "cannot read", error);
  rememberKey(path, status, key);
  return key;
}

tn::Result<void> makeDirectories(const std::string& directory) {
  for (size_t slash = directory.find('/', 1);; slash = directory.find('/', slash + 1)) {
    const std::string prefix = directory.substr(0, slash);
    if (!prefix.empty() && ::mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) {
      return keyError(prefix, "cannot create the directory", errno);
    }
    if (slash == std::string::npos) return {};
  }
}

// Writes a new random key to path, unless a key is there already (then
// EEXIST): of two processes creating it at once exactly one wins. The
// temporary file is the atomic writer's, so a creator killed half-way leaves
// nothing that the next one does not clean up.
tn::Result<void> createKeyFile(const std::string& path) {
  const std::string directory = path.substr(0, path.rfind('/'));
  if (tn::Result<void> made = makeDirectories(directory); !made) return made;
  (void)tn::removeStaleTemporaryFiles(directory);
  SandboxKey key{};
  if (RAND_bytes(key.data(), static_cast<int>(key.size())) != 1) return keyError(path, "no randomness", EIO);
  tn::Result<void> created = tn::createFileAtomically(
      path, std::string_view(reinterpret_cast<const char*>(key.data()), key.size()), 0600);
  if (!created) return keyError(path, "cannot create", static_cast<int>(created.error().code()));
  return {};
}

}  // namespace

std::string sandboxKeyPath() {
  return paths::currentLayout().sandboxKeyFile;
}

tn::Result<SandboxKey> readSandboxKey() { return readKeyFile(sandboxKeyPath()); }

tn::Result<SandboxKey> loadOrCreateSandboxKey() {
  const std::string path = sandboxKeyPath();
  if (std::optional<SandboxKey> kept = keptIssuingKey(path)) return *kept;
  // Another process may remove the key between our link and our read; a few
  // rounds settle that, and a file that keeps vanishing is an error.
  constexpr int kAttempts = 4;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    tn::Result<SandboxKey> existing = readKeyFile(path);
    if (existing) return keepIssuingKey(path, *existing);
    if (existing.error().code() != ENOENT) return existing;
    tn::Result<void> created = createKeyFile(path);
    if (!created && created.error().code() != EEXIST) return created.error();
    // Created here or by a process that raced us: read whichever won.
  }
  return keyError(path, "cannot create", EAGAIN);
}

}  // namespace sandbox
