// ServicePath: where the socket of a named service lives.
//
// $TENON_ROOT/run/tenon/relay/<service> (TENON_ROOT empty by default, so
// /run/tenon/relay/<service>). Tests and the demo point TENON_ROOT at a
// private directory.

#pragma once

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace relay {

// Refuses (InvalidServiceName) a name that is empty, "." or "..", holds a
// '/' or a NUL byte, or makes a socket path too long for a Unix socket
// address under the current TENON_ROOT.
tn::Result<void> validateServiceName(std::string_view serviceName);

// The directory holding every service socket: $TENON_ROOT/run/tenon/relay.
// Reads TENON_ROOT at each call.
std::string relayDirectory();

// The socket path of a service (validated with validateServiceName).
tn::Result<std::string> servicePath(std::string_view serviceName);

// Creates `path` and any missing parents, each new directory with exactly
// `mode` (whatever the umask). Existing directories are left as they are.
tn::Result<void> createDirectories(const std::string& path, unsigned mode);

}  // namespace relay
