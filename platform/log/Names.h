// Names: the subsystem and categories Tenon logs under.

#pragma once

#include <array>
#include <string_view>

namespace tn::log {

inline constexpr std::string_view kSubsystem = "com.ostrel.Tenon";

// The five categories, each with one process-wide log object (Categories.h).
inline constexpr std::array<std::string_view, 5> kCategoryNames = {"ops", "traffic", "extension",
                                                                   "rg", "sandbox"};

// Category of the default log, the log object with no subsystem.
inline constexpr std::string_view kDefaultCategory = "default";

}  // namespace tn::log
