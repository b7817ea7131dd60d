// Descriptors: file descriptors that travel with a frame.
//
// A frame may carry up to kMaxDescriptorsPerFrame open file descriptors,
// passed as SCM_RIGHTS ancillary data of the socket write that carries the
// frame's first byte (docs/relay.md, "Descriptors"). The receiver gets them
// close-on-exec and owns them; they are closed when their owner lets go, and
// they are closed at once, never installed anywhere else, when the frame
// that brought them is refused.
//
// The cap keeps what one frame can make a process hold small: descriptors
// are a resource of the whole process, and a peer that could send hundreds
// with each request could exhaust the daemon's file limit. Server
// connections accept none at all unless their listener allows them
// (Listener::Limits::descriptorsPerRequest); client connections accept up to
// the cap in replies, since a service hands a client its end of a
// conversation that way.

#pragma once

#include <cstddef>
#include <vector>

#include "platform/relay/UniqueFd.h"

namespace relay {

inline constexpr std::size_t kMaxDescriptorsPerFrame = 4;

using Descriptors = std::vector<UniqueFd>;

}  // namespace relay
