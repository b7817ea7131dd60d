#pragma once

// tools/tnctl: the command-line tool of Tenon. Each subcommand lives in its
// own file and registers itself on the application with an add…Command
// function; main.cpp only assembles them.

#include <CLI/CLI.hpp>

namespace tnctl {

// Options every subcommand shares.
struct GlobalOptions {
  bool json = false;  // machine-readable output
};

// Subcommand callbacks report failure by throwing CommandFailed after they
// have printed their one error line; main turns it into exit status 1.
struct CommandFailed {
  int status = 1;
};

// Prints "tnctl: <message>" on stderr and throws CommandFailed.
[[noreturn]] void fail(const std::string& message);

void addDocumentCommand(CLI::App& app, const GlobalOptions& options);

}  // namespace tnctl
