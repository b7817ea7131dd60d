// SandboxProfile: what a started plug-in may touch, as a document of
// Tenon's own at $TENON_ROOT/usr/share/tenon/sandbox-profiles/<name>.manifest
// (a structured-value document, XML or JSON; docs/warden.md):
//
//   {"version": 1,
//    "read-only": ["/usr", "/etc/ld.so.cache"],
//    "read-write": ["/dev/null"],
//    "deny-system-calls": ["ptrace", "mount", "bpf"]}
//
// "version" must be 1. The path lists (absolute paths, at most 256 each)
// name what the plug-in may read (and execute), or read and change, beyond
// what every plug-in gets: its own bundle, read-only, and its data
// container, read-write. "deny-system-calls" names calls that fail with
// EPERM (names from the table in SeccompProgram.h; one that table does not
// know is an error, one this machine does not have is skipped). Unknown
// keys are errors too: a profile that says more than this reader
// understands must not be applied as if it said less.
//
// A name is 1 to 64 characters of a-z, 0-9 and '-', so it can never leave
// the profiles directory.

#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace warden {

inline constexpr std::size_t kMaxProfilePaths = 256;

bool isProfileName(std::string_view name);

struct SandboxProfile {
  std::string name;
  std::vector<std::string> readOnly;
  std::vector<std::string> readWrite;
  std::vector<std::string> deniedSystemCalls;

  // $TENON_ROOT/usr/share/tenon/sandbox-profiles (TENON_ROOT read now).
  static std::string directory();
  // <directory>/<name>.manifest.
  static std::string pathOf(std::string_view name);

  // Reads the profile of that name. Errors (domain "warden"): ENOENT for a
  // missing file, EINVAL for a bad name or a malformed document; the
  // message names the file.
  static tn::Result<SandboxProfile> load(std::string_view name);

  // The profile a parsed document holds; `path` only names it in errors.
  static tn::Result<SandboxProfile> fromDocument(const tn::Value& document, std::string_view name,
                                                 const std::string& path);
};

}  // namespace warden
