// Fatal errors of the dispatch layer.
//
// A broken precondition of this layer (a sync that would deadlock, a block run
// off its queue, a block that throws) is a programming error, never input. It
// ends the process at once with one line on stderr, so that the failure shows
// where it happened instead of as a hang later. The layer has no logging
// dependency on purpose: it sits below platform/log.

#pragma once

#include <string_view>

namespace tn::dispatch::detail {

// Writes "tenon: fatal: <message>\n" to stderr in one write and calls
// std::abort(). Safe to call from any thread, also with locks held.
[[noreturn]] void fatal(std::string_view message);

// fatal() for a block that ended with an exception. `what` is the exception's
// message, or null when the exception was not a std::exception.
[[noreturn]] void fatalBlockThrew(std::string_view where, const char* what);

}  // namespace tn::dispatch::detail
