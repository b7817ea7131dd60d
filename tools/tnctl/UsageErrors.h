#pragma once

// tnctl's usage errors in its own words: what the command-line parser
// refused, named ("unknown subcommand \"frob\"", "unknown option
// \"--jsno\" for tnctl match"), on one "tnctl:" line, exit status 2.

#include <string>

#include <CLI/CLI.hpp>

namespace tnctl {

// The message for a parse error of `app` (the whole command line).
std::string usageMessage(const CLI::App& app, const CLI::ParseError& error);

}  // namespace tnctl
