#include "platform/relay/ProcessStartTime.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <string>

#include <fmt/format.h>

#include "platform/relay/UniqueFd.h"

namespace relay {
namespace {

// Fields after the command name: field 3 (state) is the first, so the start
// time, field 22, is the 20th.
constexpr int kStartTimeFieldAfterName = 20;

}  // namespace

std::optional<uint64_t> processStartTime(pid_t pid) {
  const std::string path = fmt::format("/proc/{}/stat", pid);
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;
  // The whole file is well under a page; a command name is at most 64 bytes.
  std::array<char, 4096> buffer{};
  std::size_t size = 0;
  while (size < buffer.size()) {
    const ssize_t n = ::read(fd.get(), buffer.data() + size, buffer.size() - size);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return std::nullopt;
    if (n == 0) break;
    size += static_cast<std::size_t>(n);
  }
  return parseStartTime(std::string_view(buffer.data(), size));
}

std::optional<uint64_t> parseStartTime(std::string_view statText) {
  const std::size_t nameEnd = statText.rfind(')');
  if (nameEnd == std::string_view::npos) return std::nullopt;
  std::string_view rest = statText.substr(nameEnd + 1);
  for (int field = 1; field <= kStartTimeFieldAfterName; ++field) {
    const std::size_t start = rest.find_first_not_of(' ');
    if (start == std::string_view::npos) return std::nullopt;
    rest = rest.substr(start);
    const std::size_t end = std::min(rest.find(' '), rest.size());
    if (field == kStartTimeFieldAfterName) {
      std::string_view text = rest.substr(0, end);
      if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
      uint64_t value = 0;
      const auto [ptr, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
      if (ec != std::errc() || ptr != text.data() + text.size() || text.empty()) return std::nullopt;
      return value;
    }
    rest = rest.substr(end);
  }
  return std::nullopt;
}

}  // namespace relay
