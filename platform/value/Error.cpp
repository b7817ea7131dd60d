#include "platform/value/Error.h"

namespace tn {

std::string Error::localizedDescription() const {
  if (message_) return *message_;
  return fmt::format("The operation could not be completed ({} error {})", domain_, code_);
}

std::string Error::description() const {
  if (message_) return fmt::format("{} {}: {}", domain_, code_, *message_);
  return fmt::format("{} {}", domain_, code_);
}

Error TNMakeError(int64_t code, std::optional<std::string> message) {
  return Error(std::string(kTenonErrorDomain), code, std::move(message));
}

}  // namespace tn
