#include "platform/warden/LandlockRuleset.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>

#include <fmt/format.h>

#include "platform/warden/WardenError.h"

namespace warden {
namespace {

// The access rights of each ABI version, cumulative.
uint64_t handledRights(int abi) {
  uint64_t rights = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_READ_FILE |
                    LANDLOCK_ACCESS_FS_READ_DIR | LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_REMOVE_FILE |
                    LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
                    LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_BLOCK |
                    LANDLOCK_ACCESS_FS_MAKE_SYM;
  if (abi >= 2) rights |= 1ULL << 13;  // REFER
  if (abi >= 3) rights |= 1ULL << 14;  // TRUNCATE
  if (abi >= 5) rights |= 1ULL << 15;  // IOCTL_DEV
  return rights;
}

// Rights that make sense on a file that is not a directory.
uint64_t fileRights(int abi) {
  uint64_t rights = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_READ_FILE;
  if (abi >= 3) rights |= 1ULL << 14;
  if (abi >= 5) rights |= 1ULL << 15;
  return rights;
}

constexpr uint64_t kReadRights =
    LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;

tn::Result<void> addRule(int ruleset, const std::string& path, uint64_t rights, int abi) {
  const relay::UniqueFd fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (!fd.valid()) return {};  // nothing there: nothing to grant
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return makeSystemError(fmt::format("stat {}", path), errno);
  landlock_path_beneath_attr rule{};
  rule.allowed_access = S_ISDIR(status.st_mode) ? rights : (rights & fileRights(abi));
  rule.parent_fd = fd.get();
  if (::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) != 0) {
    return makeSystemError(fmt::format("landlock rule for {}", path), errno);
  }
  return {};
}

}  // namespace

int landlockAbi() {
  const long abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  return abi > 0 ? static_cast<int>(abi) : 0;
}

tn::Result<relay::UniqueFd> buildLandlockRuleset(const std::vector<std::string>& readOnly,
                                                 const std::vector<std::string>& readWrite) {
  const int abi = landlockAbi();
  if (abi == 0) return relay::UniqueFd();
  landlock_ruleset_attr attributes{};
  attributes.handled_access_fs = handledRights(abi);
  const long fd = ::syscall(SYS_landlock_create_ruleset, &attributes, sizeof attributes, 0);
  if (fd < 0) return makeSystemError("landlock_create_ruleset", errno);
  relay::UniqueFd ruleset(static_cast<int>(fd));  // the kernel makes it close-on-exec
  for (const std::string& path : readOnly) {
    if (tn::Result<void> added = addRule(ruleset.get(), path, kReadRights, abi); !added.ok()) return added.error();
  }
  for (const std::string& path : readWrite) {
    if (tn::Result<void> added = addRule(ruleset.get(), path, handledRights(abi), abi); !added.ok()) {
      return added.error();
    }
  }
  return ruleset;
}

}  // namespace warden
