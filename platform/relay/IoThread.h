// IoThread: the one thread of the process that does socket I/O for the relay.
//
// It runs an Asio io_context, started on first use and never stopped: it
// waits for sockets to become readable or writable, moves bytes, and posts
// the results to serial queues. Nothing else runs on it; code posted here
// must not block and must not call into user code.
//
// Internal to platform/relay.

#pragma once

#include <asio/io_context.hpp>

namespace relay::detail {

// The process's io_context; its thread is started by the first call. The
// object is never destroyed, so handlers may run while the process exits.
// Threads: any.
asio::io_context& ioContext();

// True on the I/O thread.
bool onIoThread();

}  // namespace relay::detail
