#pragma once

// The daemon's file descriptors, and how many connections they allow.
//
// Every connection costs the daemon descriptors (its socket and the peer's
// pidfd, and briefly a few more while the peer is identified), and the
// daemon needs some of its own (registrar store, inotify, annotation file,
// logs). Whatever limit the daemon inherits, it raises the soft limit to
// the hard one at start-up, and caps connections so that a crowd of
// clients runs into the connection cap, which refuses cleanly, long before
// accept() runs out of descriptors for everybody.

#include <cstddef>
#include <optional>

#include "platform/relay/Listener.h"

namespace tnd {

// Raises the soft RLIMIT_NOFILE to the hard limit (logged when it changes)
// and returns the soft limit in force afterwards.
std::size_t raiseFileLimit();

// The soft RLIMIT_NOFILE now.
std::size_t currentFileLimit();

// The listener limits for a daemon with `fileLimit` descriptors: per uid
// `perUser` (default 64); in total `total` (default: 4096, or what the
// descriptors allow with room to spare), never more than they allow (a
// configured total above that is lowered, and logged); a reserve of the
// total for root and the daemon's own user.
relay::Listener::Limits connectionLimits(std::size_t fileLimit, std::optional<std::size_t> perUser,
                                         std::optional<std::size_t> total);

}  // namespace tnd
