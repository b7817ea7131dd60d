#pragma once

// tools/tnctl: the command-line tool of Tenon. Each subcommand (or group of
// related ones) lives in its own file and registers itself on the
// application with an add…Command(s) function; main.cpp only assembles them.

#include <string>

#include <CLI/CLI.hpp>

#include "tools/tnctl/Outcome.h"

namespace tnctl {

// Options every subcommand shares. Filled in by parsing; subcommand
// callbacks read them when they run, after parsing.
struct GlobalOptions {
  bool json = false;                                     // machine-readable output
  std::string service = "com.ostrel.tenon.tenond";       // the daemon's relay service
  unsigned timeoutSeconds = 30;                          // how long to wait for a reply
};

void addDocumentCommand(CLI::App& app, const GlobalOptions& options);
void addLintCommand(CLI::App& app, const GlobalOptions& options);  // lint BUNDLE|MANIFEST
void addRegistryCommands(CLI::App& app, const GlobalOptions& options);  // registry list|show|scan
void addConsentCommands(CLI::App& app, const GlobalOptions& options);   // consent grant|revoke|list

// Subcommands that talk to tenond, one per client operation.
void addRegistrationCommands(CLI::App& app, const GlobalOptions& options);  // add, remove, bulk
void addLookupCommands(CLI::App& app, const GlobalOptions& options);        // find
void addDiscoveryCommands(CLI::App& app, const GlobalOptions& options);     // match, explain
void addReadinessCommands(CLI::App& app, const GlobalOptions& options);     // ready, access
void addAnnotationCommands(CLI::App& app, const GlobalOptions& options);    // annotate, bulk-annotate
void addHoldCommands(CLI::App& app, const GlobalOptions& options);          // hold, release
void addRequestCommand(CLI::App& app, const GlobalOptions& options);        // request (raw)

// The supervisor's own service.
void addWardenCommands(CLI::App& app, const GlobalOptions& options);  // warden list
void addStartCommand(CLI::App& app, const GlobalOptions& options);    // start: find, ready, start, talk

}  // namespace tnctl
