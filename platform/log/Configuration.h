// Configuration: turning info and debug on and off.
//
// The environment variable TENON_LOG is read once, at the first use of any
// log object made by createLog(), the default log or a category accessor.
// Its syntax is LogSettings.h's; items it cannot use are reported once on the
// default log at error level and ignored.

#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace tn::log {

// Replaces the level settings of every log object, present and future, with
// those `spec` describes (LogSettings.h syntax; "" turns info and debug off
// everywhere). Reads TENON_LOG first if nothing has yet, so a later first
// use does not undo this call. Returns the problems found in `spec`, which
// are also logged on the default log at error level. Thread-safe.
std::vector<std::string> configure(std::string_view spec);

// Reads and applies TENON_LOG unless that was done before. Thread-safe;
// later calls return at once.
void readEnvironmentOnce();

}  // namespace tn::log
