#include "platform/log/StderrSink.h"

#include <cerrno>
#include <ctime>
#include <fmt/format.h>

namespace tn::log {

namespace {

// Appends `text` with line breaks escaped, keeping the message on one line.
// The log layer escaped every message already (Escape.h), so this only
// guards records a program hands to the sink itself; it must not escape
// again (a backslash would double).
void appendOneLine(std::string& line, std::string_view text) {
  for (char c : text) {
    if (c == '\n') {
      line += "\\n";
    } else if (c == '\r') {
      line += "\\r";
    } else {
      line += c;
    }
  }
}

void writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      return;
    }
    bytes.remove_prefix(static_cast<std::size_t>(written));
  }
}

}  // namespace

std::string formatTimestamp(std::chrono::system_clock::time_point time) {
  using namespace std::chrono;
  auto sinceEpoch = time.time_since_epoch();
  auto wholeSeconds = floor<seconds>(sinceEpoch);
  auto millis = duration_cast<milliseconds>(sinceEpoch - wholeSeconds).count();
  std::time_t seconds = static_cast<std::time_t>(wholeSeconds.count());
  std::tm utc{};
  gmtime_r(&seconds, &utc);
  return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:03}Z", utc.tm_year + 1900,
                     utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min, utc.tm_sec,
                     millis);
}

StderrSink::StderrSink(int fd) : StderrSink(fd, program_invocation_short_name) {}

StderrSink::StderrSink(int fd, std::string programName)
    : fd_(fd), programName_(std::move(programName)), pid_(::getpid()) {}

std::string StderrSink::formatLine(const Record& record) const {
  std::string line = fmt::format("{} {}[{}] {}.{}: ", formatTimestamp(record.timestamp),
                                 programName_, pid_, record.category, levelName(record.level));
  appendOneLine(line, record.text);
  line += '\n';
  return line;
}

void StderrSink::write(const Record& record) {
  std::string line = formatLine(record);
  std::lock_guard lock(writing_);
  writeAll(fd_, line);
}

}  // namespace tn::log
