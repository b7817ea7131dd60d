// LogMacros: the logging calls.
//
//   TN_LOG_DEBUG(tn::log::ops(), "client {} sent {} requests", pid, count);
//   TN_LOG_ERROR(tn::log::defaultLog(), "unable to create tracelog for category {}", name);
//
// TN_LOG_DEFAULT, TN_LOG_INFO, TN_LOG_DEBUG and TN_LOG_ERROR take a log
// object (Log&), a format string literal in the formatting library's syntax
// (checked at compile time against the arguments) and zero or more
// arguments. The log expression is evaluated exactly once. When the level is
// off for that log object the call costs one branch: no argument is
// evaluated and nothing is formatted, so arguments may be expensive
// (descriptions of messages, UUID strings). The format string literal's
// address identifies the call site to the rate limiter (RateLimiter.h),
// which is asked first: a suppressed line is not formatted either.

#pragma once

#include <fmt/format.h>

#include "platform/log/Level.h"
#include "platform/log/LogObject.h"

#define TN_LOG_AT_LEVEL(tn_level_, tn_log_, tn_format_, ...)                          \
  do {                                                                                \
    ::tn::log::Log& tn_log_object_ = (tn_log_);                                       \
    if (tn_log_object_.enabled(tn_level_) &&                                          \
        tn_log_object_.admit(tn_level_, static_cast<const void*>(tn_format_))) [[unlikely]] { \
      tn_log_object_.writeAdmitted(tn_level_,                                         \
                                   ::fmt::format(FMT_STRING(tn_format_) __VA_OPT__(, ) __VA_ARGS__)); \
    }                                                                                 \
  } while (0)

#define TN_LOG_DEFAULT(tn_log_, tn_format_, ...) \
  TN_LOG_AT_LEVEL(::tn::log::Level::Default, tn_log_, tn_format_ __VA_OPT__(, ) __VA_ARGS__)
#define TN_LOG_INFO(tn_log_, tn_format_, ...) \
  TN_LOG_AT_LEVEL(::tn::log::Level::Info, tn_log_, tn_format_ __VA_OPT__(, ) __VA_ARGS__)
#define TN_LOG_DEBUG(tn_log_, tn_format_, ...) \
  TN_LOG_AT_LEVEL(::tn::log::Level::Debug, tn_log_, tn_format_ __VA_OPT__(, ) __VA_ARGS__)
#define TN_LOG_ERROR(tn_log_, tn_format_, ...) \
  TN_LOG_AT_LEVEL(::tn::log::Level::Error, tn_log_, tn_format_ __VA_OPT__(, ) __VA_ARGS__)
