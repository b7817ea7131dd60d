// LandlockRuleset: the file-system confinement of a started plug-in.
//
// Made in the supervisor before the child exists: a Landlock ruleset that
// handles every file-system access right this kernel knows, with rules that
// grant read and execute under each read-only path and everything under
// each read-write path. The child enforces it with landlock_restrict_self()
// after no_new_privs, so from its exec on the plug-in reaches nothing else
// in the file system (the access rights Landlock does not cover, such as
// connecting to a socket by path, are left to the seccomp program and to
// ordinary permissions).
//
// A path that does not exist is skipped (profiles name /lib64 and the like,
// which not every machine has). On a kernel without Landlock, or with it
// disabled, there is no ruleset and the plug-in runs with seccomp alone;
// landlockAbi() tells which.

#pragma once

#include <string>
#include <vector>

#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"

namespace warden {

// The kernel's Landlock ABI version; 0 when it has none (or it is off).
int landlockAbi();

// The ruleset fd (close-on-exec), or an invalid fd when landlockAbi() is 0.
// Errors (domain "warden", errno codes): a rule the kernel refused.
tn::Result<relay::UniqueFd> buildLandlockRuleset(const std::vector<std::string>& readOnly,
                                                 const std::vector<std::string>& readWrite);

}  // namespace warden
