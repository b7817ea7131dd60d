// Record: one log message on its way from a log object to a sink.
//
// A record only borrows its strings: they stay valid for the duration of the
// Sink::write call that receives it. A sink that keeps a record must copy it
// (CaptureSink keeps CapturedRecord copies).

#pragma once

#include <chrono>
#include <string_view>
#include <sys/types.h>

#include "platform/log/Level.h"

namespace tn::log {

struct Record {
  std::string_view subsystem;  // "com.ostrel.Tenon"; empty for the default log
  std::string_view category;   // "ops", "traffic", ...; "default" for the default log
  Level level = Level::Default;
  std::string_view text;       // the formatted message
  std::chrono::system_clock::time_point timestamp;
  pid_t thread = 0;            // kernel thread id of the writer
};

}  // namespace tn::log
