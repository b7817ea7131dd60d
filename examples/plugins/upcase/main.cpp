// upcase: an example plug-in program. The supervisor starts it for a host
// and hands it one end of a socket (TENON_PLUGIN_SOCKET); the host writes
// lines and gets one line back for each:
//
//   any text        the text in upper case (the plug-in is busy meanwhile)
//   whoami          "uid=<uid> filters=<seccomp filters>"
//   env             its environment, entries separated by spaces, sorted
//   write <path>    "ok" when it could create <path>, else "refused <reason>"
//   hold / release  declares itself busy / idle until told otherwise
//
// It exits when the host closes its end.

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "libtenon/client/TNPlugInInstance.h"

namespace {

std::string seccompFilters() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("Seccomp_filters:", 0) == 0) return line.substr(line.find_first_not_of(" \t", 16));
  }
  return "unknown";
}

std::string tryWrite(const std::string& path) {
  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) return std::string("refused ") + std::strerror(errno);
  ::close(fd);
  return "ok";
}

std::string environmentText() {
  std::vector<std::string> entries;
  for (char** entry = environ; *entry != nullptr; ++entry) entries.emplace_back(*entry);
  std::sort(entries.begin(), entries.end());
  std::string text;
  for (const std::string& entry : entries) text += (text.empty() ? "" : " ") + entry;
  return text;
}

std::string upperCase(std::string text) {
  for (char& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return text;
}

std::string answer(tn::TNPlugInInstance& instance, const std::string& line) {
  if (line == "whoami") return "uid=" + std::to_string(::getuid()) + " filters=" + seccompFilters();
  if (line.rfind("write ", 0) == 0) return tryWrite(line.substr(6));
  if (line == "env") return environmentText();
  if (line == "hold") {
    const tn::Result<void> declared = instance.declareBusy();
    return declared.ok() ? "busy" : "busy-failed " + declared.error().localizedDescription();
  }
  if (line == "release") {
    const tn::Result<void> declared = instance.declareIdle();
    return declared.ok() ? "idle" : "idle-failed " + declared.error().localizedDescription();
  }
  // Busy while working; the work is small, but a host that asks the
  // platform meanwhile must see it.
  (void)instance.declareBusy();
  std::string result = upperCase(line);
  (void)instance.declareIdle();
  return result;
}

bool writeAll(int fd, const std::string& text) {
  for (std::size_t sent = 0; sent < text.size();) {
    const ssize_t n = ::write(fd, text.data() + sent, text.size() - sent);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    sent += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

int main() {
  const std::optional<int> socket = tn::TNPlugInInstance::hostSocket();
  if (!socket) {
    std::fprintf(stderr, "upcase: TENON_PLUGIN_SOCKET names no descriptor\n");
    return 2;
  }
  tn::TNPlugInInstance instance;
  std::string pending;
  char buffer[4096];
  for (;;) {
    const ssize_t n = ::read(*socket, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return 0;
    pending.append(buffer, static_cast<std::size_t>(n));
    for (std::size_t end; (end = pending.find('\n')) != std::string::npos;) {
      const std::string line = pending.substr(0, end);
      pending.erase(0, end + 1);
      if (!writeAll(*socket, answer(instance, line) + "\n")) return 0;
    }
  }
}
