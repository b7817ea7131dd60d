// Level: how important a log message is.
//
// Tenon has exactly four levels. Default and error messages are always
// written; info and debug messages only when TENON_LOG (or configure())
// turns them on for the message's category. Debug implies info.

#pragma once

#include <optional>
#include <string_view>

namespace tn::log {

enum class Level : unsigned char { Default = 0, Info = 1, Debug = 2, Error = 3 };

// Returns the level's lower-case name: "default", "info", "debug", "error".
std::string_view levelName(Level level) noexcept;

// Returns the level named `name` (one of the names above, exact spelling),
// or nullopt for anything else.
std::optional<Level> parseLevel(std::string_view name) noexcept;

}  // namespace tn::log
