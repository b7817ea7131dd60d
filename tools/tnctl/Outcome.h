#pragma once

// How a tnctl command ends: its outcome on stdout and its exit status.
//
//   0  success
//   1  the command failed (a bad file, a refusal, a daemon that cannot be
//      reached): one line "tnctl: <message>" on stderr
//   2  a usage error (an unknown subcommand or option, a missing argument):
//      one line "tnctl: <message>" on stderr
//
// Under --json every outcome is exactly one JSON document on stdout: the
// command's own, or for a failure that printed none
// {"ok": false, "error": "<message>", ...details}. The line on stderr is
// written either way, for people watching a script run.

#include <string>

#include "platform/value/Value.h"

namespace tnctl {

inline constexpr int kFailureStatus = 1;
inline constexpr int kUsageStatus = 2;

// Subcommand callbacks report failure by throwing CommandFailed after the
// outcome has been printed; main turns it into the exit status.
struct CommandFailed {
  int status = kFailureStatus;
};

// Set once by main, before any command runs.
void setJsonOutcome(bool json);
bool jsonOutcome();

// Writes `document` as JSON on stdout: the one document of this run. Its
// dates are written as displayDate strings (DisplayDate.h).
void printJsonDocument(const tn::Value& document);

// Prints "tnctl: <message>" on stderr (and, under --json, the error
// document with `details` unless a document was printed already) and
// throws CommandFailed with `status`.
[[noreturn]] void fail(const std::string& message, const tn::Dictionary& details = {},
                       int status = kFailureStatus);

// The same for a usage error: exit status 2, "usage": true in the document.
[[noreturn]] void failUsage(const std::string& message);

}  // namespace tnctl
