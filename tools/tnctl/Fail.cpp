#include <fmt/format.h>

#include "tools/tnctl/Command.h"

namespace tnctl {

void fail(const std::string& message) {
  fmt::print(stderr, "tnctl: {}\n", message);
  throw CommandFailed{};
}

}  // namespace tnctl
