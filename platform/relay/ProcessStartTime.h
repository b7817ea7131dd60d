// ProcessStartTime: when a process started, as the kernel counts it.
//
// Field 22 of /proc/<pid>/stat: clock ticks since boot. Together with the
// pid it names one process for the life of the system: a pid that is reused
// belongs to a process that started later.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string_view>

namespace relay {

// The start time of process `pid`, or none when it does not exist (any
// more) or its stat file cannot be read or parsed.
std::optional<uint64_t> processStartTime(pid_t pid);

// Field 22 of the text of a /proc/<pid>/stat file. The command name (field
// 2, in parentheses) may itself hold spaces and parentheses, so fields are
// counted from the last ')'.
std::optional<uint64_t> parseStartTime(std::string_view statText);

}  // namespace relay
