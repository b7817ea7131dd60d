// WardenError: the errors of the supervisor (domain "warden").
//
// Codes are errno numbers, so that addExternalService() can answer "0 or an
// error number" as its callers expect, and so that the service's replies
// carry one number space:
//   EINVAL  a malformed overlay, request or profile
//   ENOENT  no such executable, bundle or profile
//   ESRCH   the host process is gone
//   EPERM   not allowed: no registration for this host, or a user the
//           supervisor cannot become
//   EUSERS  too many registrations or instances (per host or in all)
//   and the errno of a failed system call.

#pragma once

#include <string>
#include <string_view>

#include "platform/value/Error.h"

namespace warden {

inline constexpr std::string_view kWardenErrorDomain = "warden";

tn::Error makeWardenError(int code, std::string message);

// makeWardenError(errnoValue, "<what>: <strerror>").
tn::Error makeSystemError(std::string_view what, int errnoValue);

}  // namespace warden
