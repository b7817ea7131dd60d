#pragma once

// libtenon/model: the plug-in model shared by the daemon and client processes.
// This header: ordering of version strings, used by discovery to keep the
// newest plug-in of an identifier.

#include <string_view>

namespace tn {

// Compares two version strings character by character, except that runs of
// decimal digits at the same place in both are compared as whole numbers
// (so "1.10" is newer than "1.9" and "10" newer than "9"). Other characters
// compare by value, case-sensitively; a string that is a prefix of the other
// orders first. Answers -1 when `receiver` is older, 0 when equal, 1 when newer.
int compareVersionString(std::string_view receiver, std::string_view other);

}  // namespace tn
