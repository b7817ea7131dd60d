#include "platform/log/LogContext.h"

#include "platform/log/LogObject.h"
#include "platform/log/RateLimiter.h"

namespace tn::log {
namespace {

thread_local ContextId tCurrentContext = 0;

}  // namespace

ContextId currentContext() noexcept { return tCurrentContext; }

ContextScope::ContextScope(ContextId context) noexcept : previous_(tCurrentContext) { tCurrentContext = context; }

ContextScope::~ContextScope() { tCurrentContext = previous_; }

void endContext(ContextId context) { detail::writeSummaries(detail::rateLimiter().endContext(context)); }

}  // namespace tn::log
