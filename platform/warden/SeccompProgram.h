// SeccompProgram: the seccomp filter a started plug-in runs under.
//
// The program fails the system calls a profile denies with EPERM, fails
// every call of another ABI of the same machine (x32 on x86-64) the same
// way, kills the process on a call from a foreign architecture, and allows
// everything else. Any filter at all also marks the process as sandboxed to
// the daemon's test (platform/sandbox/SandboxCheck.h: more seccomp filters
// than the daemon), which is the other reason every plug-in gets one.
//
// Built in the supervisor before the child is made, so the child installs
// it with one prctl and allocates nothing.

#pragma once

#include <linux/filter.h>

#include <string>
#include <string_view>
#include <vector>

namespace warden {

// True for a name in the table of deniable calls (whether or not this
// machine has that call).
bool isKnownSystemCall(std::string_view name);

// The filter for a profile's denied calls (names from the table; calls this
// machine lacks are left out).
std::vector<sock_filter> buildSeccompProgram(const std::vector<std::string>& denied);

}  // namespace warden
