// LogSettings: which optional levels are on, per category, and the parser
// for their text form (the TENON_LOG syntax).
//
// The text is a comma-separated list of items:
//   info | debug              every category (and the default log) at that
//                             verbosity
//   <category>=info|debug     one of the five categories
// "default" and "error" are accepted wherever info/debug are and mean "only
// the always-on levels". Debug implies info. A named category's setting wins
// over a bare level whatever their order; among items of the same kind the
// last one wins. Spaces around items are ignored; names are case-sensitive.
//
//   TENON_LOG=info                      info everywhere
//   TENON_LOG=ops=debug,sandbox=info    debug (and info) for ops, info for sandbox
//   TENON_LOG=info,traffic=debug        info everywhere, debug for traffic too

#pragma once

#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/Level.h"

namespace tn::log {

// How many of the optional levels are on.
enum class Verbosity : unsigned char { Quiet, Info, Debug };

struct LogSettings {
  Verbosity everywhere = Verbosity::Quiet;
  std::map<std::string, Verbosity, std::less<>> categories;

  // The verbosity of `category`: its own setting if it has one, otherwise
  // `everywhere`.
  Verbosity verbosityFor(std::string_view category) const;
};

// Bit (1 << level) set for every level enabled at `verbosity`; default and
// error are always set.
unsigned enabledLevelMask(Verbosity verbosity) noexcept;

struct ParsedLogSettings {
  LogSettings settings;
  // One message per item that was ignored, naming the bad token, e.g.
  // `TENON_LOG: unknown category "net" in "net=debug", ignored`.
  std::vector<std::string> problems;
};

// Parses `text` (syntax above). `source` starts each problem message
// ("TENON_LOG" for the environment variable). Never fails: bad items are
// skipped and described in `problems`.
ParsedLogSettings parseLogSettings(std::string_view text, std::string_view source);

}  // namespace tn::log
