#include "platform/warden/WardenError.h"

#include <cstring>

#include <fmt/format.h>

namespace warden {

tn::Error makeWardenError(int code, std::string message) {
  return tn::Error(std::string(kWardenErrorDomain), code, std::move(message));
}

tn::Error makeSystemError(std::string_view what, int errnoValue) {
  return makeWardenError(errnoValue, fmt::format("{}: {}", what, std::strerror(errnoValue)));
}

}  // namespace warden
