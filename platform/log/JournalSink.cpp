// The journal client's sd_journal_sendv macro would record this file's name
// and line as the message's source location, which says nothing useful.
#define SD_JOURNAL_SUPPRESS_LOCATION 1

#include "platform/log/JournalSink.h"

#include <array>
#include <cerrno>
#include <charconv>
#include <string_view>
#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>

namespace tn::log {

namespace {

// Parses a whole decimal number; false on anything else.
template <typename Number>
bool parseDecimal(std::string_view text, Number& value) {
  if (text.empty()) return false;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  return error == std::errc() && end == text.data() + text.size();
}

iovec field(const std::string& text) {
  return iovec{const_cast<char*>(text.data()), text.size()};
}

}  // namespace

int journalPriority(Level level) noexcept {
  switch (level) {
    case Level::Error: return 3;
    case Level::Default: return 5;
    case Level::Info: return 6;
    case Level::Debug: return 7;
  }
  return 5;
}

bool journalStreamMatches(const char* journalStream, int fd) noexcept {
  if (journalStream == nullptr) return false;
  std::string_view value(journalStream);
  auto colon = value.find(':');
  if (colon == std::string_view::npos) return false;
  unsigned long long device = 0;
  unsigned long long inode = 0;
  if (!parseDecimal(value.substr(0, colon), device) ||
      !parseDecimal(value.substr(colon + 1), inode)) {
    return false;
  }
  struct stat status {};
  if (::fstat(fd, &status) != 0) return false;
  return status.st_dev == device && status.st_ino == inode;
}

JournalSink::JournalSink() : JournalSink(program_invocation_short_name) {}

JournalSink::JournalSink(std::string identifier) : identifier_(std::move(identifier)) {}

void JournalSink::write(const Record& record) {
  // The journal takes "FIELD=value" byte ranges; the log layer escaped the
  // text already (Escape.h), so it is one line of valid UTF-8.
  const std::string message = "MESSAGE=" + std::string(record.text);
  const std::string priority = "PRIORITY=" + std::to_string(journalPriority(record.level));
  const std::string identifier = "SYSLOG_IDENTIFIER=" + identifier_;
  const std::string subsystem = "TENON_SUBSYSTEM=" + std::string(record.subsystem);
  const std::string category = "TENON_CATEGORY=" + std::string(record.category);
  const std::string level = "TENON_LEVEL=" + std::string(levelName(record.level));
  std::array<iovec, 6> fields = {field(message),  field(priority), field(identifier),
                                 field(category), field(level),    field(subsystem)};
  // The default log has no subsystem; it then goes without that field.
  const std::size_t count = record.subsystem.empty() ? fields.size() - 1 : fields.size();
  sd_journal_sendv(fields.data(), static_cast<int>(count));
}

}  // namespace tn::log
