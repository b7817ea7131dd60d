#include "platform/sandbox/ProcFiles.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace sandbox {

std::optional<std::string> readProcFile(const std::string& process, std::string_view name) {
  const std::string path = "/proc/" + process + "/" + std::string(name);
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  std::string text;
  char buffer[4096];
  for (;;) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      const int error = errno;
      ::close(fd);
      if (n < 0) {
        errno = error;
        return std::nullopt;
      }
      return text;
    }
    text.append(buffer, static_cast<size_t>(n));
  }
}

std::optional<std::string_view> statusField(std::string_view status, std::string_view key) {
  size_t lineStart = 0;
  while (lineStart < status.size()) {
    size_t lineEnd = status.find('\n', lineStart);
    if (lineEnd == std::string_view::npos) lineEnd = status.size();
    const std::string_view line = status.substr(lineStart, lineEnd - lineStart);
    if (line.size() > key.size() && line.starts_with(key) && line[key.size()] == ':') {
      return line.substr(key.size() + 1);
    }
    lineStart = lineEnd + 1;
  }
  return std::nullopt;
}

}  // namespace sandbox
