// IoContext: where the relay's socket I/O happens.
//
// One Asio io_context per process waits for sockets to become readable or
// writable (and for the listener's back-off timer). It has no thread of its
// own: it is the Poller of the shared ThreadPool (platform/dispatch/
// Poller.h), so an idle pool worker waits in it, moves the bytes of the
// event that woke it, and then runs the queue work those bytes produced:
// a request that arrives wakes one thread, not one per hand-off.
//
// Its handlers ("I/O handlers") run one at a time, whichever worker runs
// them; what one handler wrote, the next sees. They must not block and must
// not call into user code: they move bytes and post work to serial queues.
//
// Internal to platform/relay.

#pragma once

#include <asio/io_context.hpp>

namespace relay::detail {

// The process's io_context. The first call makes it the shared pool's
// poller. The object is never destroyed, so handlers may run while the
// process exits. Threads: any.
asio::io_context& ioContext();

}  // namespace relay::detail
