// LogContext: which client the running work belongs to, for the log's rate
// limiter (RateLimiter.h).
//
// While a client's work runs, its thread carries the client's context id
// (the daemon uses the client's pid; any non-zero number chosen by the
// caller works). Lines logged then are limited per (context, call site);
// lines logged outside any context (id 0) never are.
//
//   {
//     tn::log::ContextScope scope(client->pid());   // this thread, this block
//     ... work for the client, which may log ...
//   }
//   tn::log::endContext(client->pid());   // when the client's connection dies
//
// endContext writes the "… N similar lines suppressed" summaries the context
// still owes and frees its limiter state, so nothing is dropped silently.

#pragma once

#include <cstdint>

namespace tn::log {

using ContextId = uint64_t;

// The context of the calling thread; 0 outside any scope.
ContextId currentContext() noexcept;

// Sets the calling thread's context for its lifetime and puts the previous
// one back when destroyed. Scopes nest.
class ContextScope {
 public:
  explicit ContextScope(ContextId context) noexcept;
  ~ContextScope();
  ContextScope(const ContextScope&) = delete;
  ContextScope& operator=(const ContextScope&) = delete;

 private:
  ContextId previous_;
};

// Writes the summaries of lines suppressed in context and forgets it. Safe
// to call for a context that logged nothing, and from any thread.
void endContext(ContextId context);

}  // namespace tn::log
