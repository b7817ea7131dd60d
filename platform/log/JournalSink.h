// JournalSink: sends each record to the systemd journal as structured
// fields, for a daemon whose stderr systemd connected to the journal.
//
// Fields: MESSAGE (the text), PRIORITY (error 3, default 5, info 6, debug 7),
// SYSLOG_IDENTIFIER (the program's short name), TENON_SUBSYSTEM,
// TENON_CATEGORY and TENON_LEVEL.

#pragma once

#include <string>

#include "platform/log/Sink.h"

namespace tn::log {

class JournalSink : public Sink {
 public:
  // `identifier` defaults to the process's short name.
  JournalSink();
  explicit JournalSink(std::string identifier);

  // Sends the record with sd_journal_sendv. Failures are ignored: there is
  // nowhere left to report them. Thread-safe (the journal client is).
  void write(const Record& record) override;

 private:
  std::string identifier_;
};

// Returns the journal's syslog priority for `level`.
int journalPriority(Level level) noexcept;

// True when `journalStream` (the value of JOURNAL_STREAM, "<dev>:<ino>" in
// decimal, as systemd sets it) names the file `fd` is open on. False for a
// null, empty or malformed value, or when fstat(fd) fails.
bool journalStreamMatches(const char* journalStream, int fd) noexcept;

}  // namespace tn::log
