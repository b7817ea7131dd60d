#include "platform/relay/RelayError.h"

#include <cstring>
#include <string.h>

#include <fmt/format.h>

namespace relay {
namespace {

// strerror() may share a buffer between threads; the description table does not.
const char* describeErrno(int errnoValue) {
  const char* text = strerrordesc_np(errnoValue);
  return text != nullptr ? text : "unknown error";
}

}  // namespace

tn::Error makeRelayError(RelayErrorCode code, std::string message) {
  return tn::Error(std::string(kRelayErrorDomain), static_cast<int64_t>(code), std::move(message));
}

tn::Error makeSystemError(std::string_view what, int errnoValue) {
  return makeRelayError(RelayErrorCode::SystemError,
                        fmt::format("{}: {}", what, describeErrno(errnoValue)));
}

bool isRelayError(const tn::Error& error, RelayErrorCode code) {
  return error.domain() == kRelayErrorDomain && error.code() == static_cast<int64_t>(code);
}

}  // namespace relay
