// Sink: where log records end up (stderr, the journal, or a test capture).
//
// The process has one current sink at a time; see Output.h for how it is
// chosen and replaced.

#pragma once

#include "platform/log/Record.h"

namespace tn::log {

class Sink {
 public:
  virtual ~Sink() = default;

  // Delivers one record. Called from any thread, possibly from several at
  // once: implementations must be thread-safe. Must not throw and must not
  // log (that would recurse into the sink).
  virtual void write(const Record& record) = 0;
};

}  // namespace tn::log
