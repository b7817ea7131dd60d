#pragma once

// Notification names, the files that carry them, and the errors of
// platform/notify.

#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace notify {

inline constexpr std::string_view kNotifyErrorDomain = "Notify";

enum class NotifyErrorCode : int64_t {
  InvalidName = 1,      // see validateNotificationName
  FileSystem = 2,       // a notification file or directory could not be used
  InvalidArgument = 3,  // an observer without a queue or handler
};

// A name is valid when it can be one directory entry: not empty, not "." or
// "..", without "/" or NUL, at most 255 bytes. "com.ostrel.tenon.changed" is
// a typical name. Otherwise an InvalidName error saying why.
tn::Result<void> validateNotificationName(std::string_view name);

// $TENON_ROOT/run/tenon/notify, TENON_ROOT read when called (unset or empty
// means "/run/tenon/notify").
std::string notificationDirectory();

// notificationDirectory() + "/" + name. name must be valid.
std::string notificationPath(std::string_view name);

// Creates notificationDirectory() and the directories above it that are
// missing, each with mode 0755 whatever the umask. A FileSystem error naming
// the directory on failure.
tn::Result<void> createNotificationDirectory();

// An error of this folder's domain.
tn::Error notifyError(NotifyErrorCode code, std::string message);

}  // namespace notify
