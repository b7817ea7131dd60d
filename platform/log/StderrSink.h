// StderrSink: one text line per message on a file descriptor (stderr by
// default), for terminals and for log files.
//
//   2026-11-22T20:53:00.123Z tenond[1234] ops.info: text
//
// The time is UTC with milliseconds; then the program's short name and pid,
// the record's category and level, and the text. Newlines and carriage
// returns inside the text are written as "\n" and "\r" so that a message is
// always exactly one line.

#pragma once

#include <mutex>
#include <string>
#include <unistd.h>

#include "platform/log/Sink.h"

namespace tn::log {

class StderrSink : public Sink {
 public:
  // Writes to `fd`, which the caller keeps open for the sink's lifetime.
  // `programName` defaults to the process's short name.
  explicit StderrSink(int fd = STDERR_FILENO);
  StderrSink(int fd, std::string programName);

  // Writes the record's line with one write(2) (repeated only if the kernel
  // takes part of it) while holding the sink's lock, so lines of concurrent
  // writers never interleave. Write errors are ignored: there is nowhere
  // left to report them.
  void write(const Record& record) override;

  // Returns the line written for `record`, including the final newline.
  std::string formatLine(const Record& record) const;

 private:
  int fd_;
  std::string programName_;
  pid_t pid_;
  std::mutex writing_;
};

// Returns `time` as "YYYY-MM-DDTHH:MM:SS.mmmZ" (UTC, milliseconds truncated).
std::string formatTimestamp(std::chrono::system_clock::time_point time);

}  // namespace tn::log
