#include "platform/sandbox/SandboxCheck.h"

#include <charconv>
#include <string>

#include "platform/sandbox/ProcFiles.h"

namespace sandbox {
namespace {

// Field 22 of stat is the 20th after the command name (field 3 is the
// first field after it).
constexpr int kStartTimeFieldAfterName = 22 - 3;

std::optional<uint64_t> parseNumber(std::string_view text) {
  while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end == text.data()) return std::nullopt;
  return number;
}

std::optional<uint64_t> seccompFilterCountOf(const std::string& process) {
  const std::optional<std::string> status = readProcFile(process, "status");
  if (!status) return std::nullopt;
  return parseSeccompFilterCount(*status);
}

}  // namespace

std::optional<uint64_t> parseSeccompFilterCount(std::string_view status) {
  if (const std::optional<std::string_view> filters = statusField(status, "Seccomp_filters")) {
    return parseNumber(*filters);
  }
  const std::optional<std::string_view> mode = statusField(status, "Seccomp");
  if (!mode) return std::nullopt;
  const std::optional<uint64_t> modeNumber = parseNumber(*mode);
  if (!modeNumber) return std::nullopt;
  constexpr uint64_t kFilterMode = 2;
  return *modeNumber == kFilterMode ? 1 : 0;
}

std::optional<uint64_t> parseStartTime(std::string_view stat) {
  const size_t nameEnd = stat.rfind(')');
  if (nameEnd == std::string_view::npos) return std::nullopt;
  std::string_view rest = stat.substr(nameEnd + 1);
  for (int field = 0;; ++field) {
    while (!rest.empty() && rest.front() == ' ') rest.remove_prefix(1);
    if (rest.empty()) return std::nullopt;
    const size_t end = rest.find(' ');
    const std::string_view value = rest.substr(0, end);
    if (field == kStartTimeFieldAfterName) {
      const std::optional<uint64_t> number = parseNumber(value);
      // A trailing newline is fine; anything else in the field is not.
      if (!number || value.find_first_not_of("0123456789\n") != std::string_view::npos) return std::nullopt;
      return number;
    }
    if (end == std::string_view::npos) return std::nullopt;
    rest.remove_prefix(end);
  }
}

std::optional<uint64_t> seccompFilterCount(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  return seccompFilterCountOf(std::to_string(pid));
}

std::optional<uint64_t> processStartTime(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  const std::optional<std::string> stat = readProcFile(std::to_string(pid), "stat");
  if (!stat) return std::nullopt;
  return parseStartTime(*stat);
}

bool countsAsSandboxed(std::optional<uint64_t> peerFilters) {
  if (!peerFilters) return true;
  const std::optional<uint64_t> ours = seccompFilterCountOf("self");
  return !ours || *peerFilters > *ours;
}

bool isProcessSandboxed(pid_t pid) {
  if (pid <= 0) return false;
  const std::optional<uint64_t> theirs = seccompFilterCount(pid);
  // Our own count is read on every call: a filter we added since would
  // otherwise make peers look more sandboxed than they are.
  const std::optional<uint64_t> ours = seccompFilterCountOf("self");
  if (!theirs || !ours) return false;
  return *theirs > *ours;
}

bool isProcessSandboxed(pid_t pid, uint64_t startTime) {
  if (!isProcessSandboxed(pid)) return false;
  // Checked after reading the status: a pid is not reused while its process
  // lives, so a matching start time now means the status read was its own.
  return processStartTime(pid) == startTime;
}

}  // namespace sandbox
