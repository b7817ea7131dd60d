#pragma once

// Sandbox extensions: tokens that one process issues and another consumes to
// reach a file or an IPC service its sandbox would refuse.
//
// The four operations of the platform's sandbox, with errors as values: an
// error has domain kSandboxErrorDomain and an errno value as its code, which
// callers log as the platform's "error code".
//
// This stand-in signs tokens (ExtensionToken.h) with the per-machine key
// (SandboxKey.h), so a token cannot be forged or altered without the key.
// Consuming records the grant in this process's table of held extensions and
// answers its handle; Linux itself enforces nothing on the strength of a
// grant (docs/sandbox-tokens.md says what that does and does not protect).

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/sandbox/ExtensionToken.h"
#include "platform/value/Result.h"

namespace sandbox {

// The class of read-only file extensions.
inline constexpr std::string_view kReadOnlyFileExtensionClass = "com.ostrel.tenon.file-read";

// Flags of issueFileExtension.
inline constexpr uint32_t kCanonicalPath = 1u << 0;  // resolve the path (links, "..") first

// A file extension of extensionClass for path, which must be absolute. With
// kCanonicalPath the token names the resolved path, and a path that does not
// exist fails (ENOENT, ENOTDIR, ...); without it the path as given. EINVAL
// for an empty class, a relative path or one holding NUL; the key's error
// when the key can be neither read nor created.
tn::Result<std::string> issueFileExtension(std::string_view extensionClass, std::string_view path, uint32_t flags);

// A service-lookup extension of extensionClass for the IPC service name.
// flags must be 0 (EINVAL otherwise, and for an empty class or name).
tn::Result<std::string> issueServiceExtension(std::string_view extensionClass, std::string_view serviceName,
                                              uint32_t flags);

// Consumes token into this process: a handle (never -1) for the grant.
// Refused with EINVAL when the token is malformed or truncated, EPERM when
// its signature is not the key's (forged, altered, or signed with another
// key), ENOKEY when this machine has no key (no token can have been issued
// here). Where the key exists but this process may not read it (EACCES), the
// token's form alone is checked. Consuming one token twice gives two handles.
tn::Result<int64_t> consumeExtension(std::string_view token);

// Releases the grant of handle. EBADF when this process holds no such handle
// (never consumed, or already released).
tn::Result<void> releaseExtension(int64_t handle);

// What a held handle grants; none when the handle is not held.
struct ExtensionGrant {
  ExtensionKind kind = ExtensionKind::File;
  std::string extensionClass;
  std::string subject;
};
std::optional<ExtensionGrant> heldExtension(int64_t handle);

// Whether this process holds a file grant for path or a directory above it,
// or a service grant for that name.
bool holdsFileExtension(std::string_view path);
bool holdsServiceExtension(std::string_view serviceName);

}  // namespace sandbox
