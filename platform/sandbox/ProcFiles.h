#pragma once

// Reading a process's files under /proc: what the sandbox test (the
// seccomp fields of "status") and the supervisor (a host's credentials in
// "status") both read.

#include <optional>
#include <string>
#include <string_view>

namespace sandbox {

// The whole of /proc/<process>/<name>; process is a pid or "self". None when
// it cannot be opened or read (errno says why).
std::optional<std::string> readProcFile(const std::string& process, std::string_view name);

// The value after "<key>:" on the line of a "status" text that starts with
// it, up to the line's end; none when no line does.
std::optional<std::string_view> statusField(std::string_view status, std::string_view key);

}  // namespace sandbox
