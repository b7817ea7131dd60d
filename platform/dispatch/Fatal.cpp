#include "platform/dispatch/Fatal.h"

#include <unistd.h>

#include <cstdlib>
#include <string>

namespace tn::dispatch::detail {

void fatal(std::string_view message) {
  std::string line;
  line.reserve(message.size() + 16);
  line += "tenon: fatal: ";
  line += message;
  line += '\n';
  // One write(2) so concurrent messages from other threads do not interleave
  // within the line; stderr may be a pipe read by a test harness.
  const char* data = line.data();
  std::size_t left = line.size();
  while (left > 0) {
    const ssize_t n = ::write(STDERR_FILENO, data, left);
    if (n <= 0) {
      break;
    }
    data += n;
    left -= static_cast<std::size_t>(n);
  }
  std::abort();
}

void fatalBlockThrew(std::string_view where, const char* what) {
  std::string message = "block ";
  message += where;
  message += " threw an exception";
  if (what != nullptr) {
    message += ": ";
    message += what;
  }
  message += " (blocks must not throw)";
  fatal(message);
}

}  // namespace tn::dispatch::detail
