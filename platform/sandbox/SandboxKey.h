#pragma once

// The per-machine key that signs sandbox extension tokens.
//
// The key is 32 random bytes in $TENON_ROOT/var/lib/tenon/sandbox.key (TENON_ROOT
// read at each call; unset or empty means the real root). The first process
// that issues a token creates it, mode 0600, owned by whoever that is (the
// daemon). Creation is race-free: the key is written in full to a private
// temporary file and then hard-linked to its name, so the name never shows a
// partial key, and when two processes create it at once the link of the
// second fails and it takes the key of the first.

#include <array>
#include <cstdint>
#include <string>

#include "platform/value/Result.h"

namespace sandbox {

inline constexpr std::string_view kSandboxErrorDomain = "Sandbox";

using SandboxKey = std::array<uint8_t, 32>;

// $TENON_ROOT/var/lib/tenon/sandbox.key.
std::string sandboxKeyPath();

// The key at sandboxKeyPath(), created first when there is none. Errors have
// domain kSandboxErrorDomain, an errno value as code and a message naming the
// file ("/x/sandbox.key: cannot create: Permission denied"); a key file of
// the wrong size is refused with EINVAL and left alone. The key is the
// issuer's: once read or created it is kept in memory for its path, so later
// calls do no file-system work, and a key file replaced while this process
// runs is not seen by it.
tn::Result<SandboxKey> loadOrCreateSandboxKey();

// The key at sandboxKeyPath() without ever creating it: ENOENT when there is
// none, EACCES when this process may not read it. Keys are cached per path
// while the file (device and inode) stays the same, so a second call costs a
// stat.
tn::Result<SandboxKey> readSandboxKey();

}  // namespace sandbox
