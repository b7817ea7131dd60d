// InstancePaths: where the files of a Tenon instance live, in one place.
//
// Tenon runs as one of two kinds of instance:
//
// - the system instance (the default): the machine's one daemon, whose
//   files sit under the platform root $TENON_ROOT (unset or empty: "/");
// - a per-user instance (TENON_INSTANCE=user): the same daemon run by a
//   user for himself, whose sockets sit under $XDG_RUNTIME_DIR, whose
//   elections, preferences and keys under $XDG_STATE_HOME (default
//   ~/.local/state), whose registrar store under $XDG_CACHE_HOME (default
//   ~/.cache) and whose settings under $XDG_CONFIG_HOME (default ~/.config),
//   each in a "tenon" subdirectory. What is installed (applications, the
//   extension points, sandbox profiles, the system volume, the
//   administrator's trust settings) stays the system's, under $TENON_ROOT.
//
// Daemon and clients call the same functions, so that a client started
// with the daemon's environment finds the daemon's sockets. The environment
// is read at each call (it is a handful of getenv calls): nothing is cached,
// so a process that changes it (a test) sees the change everywhere at once.
//
// The variables, all of them: TENON_ROOT, TENON_INSTANCE ("system" or
// "user"; anything else is refused by instanceFromEnvironment), and for a
// per-user instance XDG_RUNTIME_DIR (required), XDG_STATE_HOME,
// XDG_CACHE_HOME, XDG_CONFIG_HOME and HOME.
//
// Threads: any.

#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace paths {

enum class Instance { System, User };

inline constexpr const char* kInstanceVariable = "TENON_INSTANCE";

// The environment the layout is computed from; tests build one by hand.
struct Environment {
  std::string root;           // TENON_ROOT
  std::string instance;       // TENON_INSTANCE
  std::string runtimeDirectory;  // XDG_RUNTIME_DIR
  std::string stateHome;      // XDG_STATE_HOME
  std::string cacheHome;      // XDG_CACHE_HOME
  std::string configHome;     // XDG_CONFIG_HOME
  std::string home;           // HOME

  static Environment current();
};

// Every location the platform reads or writes by default.
struct Layout {
  Instance instance = Instance::System;
  std::string root;  // the platform root, "" for "/"

  // Where the instance's services listen and post.
  std::string relayDirectory;         // <root>/run/tenon/relay
  std::string notificationDirectory;  // <root>/run/tenon/notify
  // What the instance keeps for its users.
  std::string annotationFile;         // <root>/var/db/Tenon-Annotations
  std::string preferencesDirectory;   // <root>/var/lib/tenon/prefs
  std::string registrarStore;         // <root>/var/lib/tenon/registrar.sqlite3
  std::string containersDirectory;    // <root>/var/lib/tenon/containers
  std::string sandboxKeyFile;         // <root>/var/lib/tenon/sandbox.key
  std::string consentStore;           // <root>/var/lib/tenon/consent.manifest
  std::string configurationFile;      // <root>/etc/tenon/tenond.manifest
};

// The instance TENON_INSTANCE names; an error text naming the value when it
// is neither "system" nor "user" (unset or empty: system).
std::optional<Instance> instanceNamed(std::string_view name);

// The layout of `environment`, or an error text naming what is at fault:
// an unknown instance name, or a per-user instance without an absolute
// XDG_RUNTIME_DIR, or without an absolute HOME for an XDG directory left
// unset. Relative XDG_*_HOME values are ignored, as the XDG rules say.
struct LayoutResult {
  std::optional<Layout> layout;
  std::string error;
};
LayoutResult layoutFor(const Environment& environment);

// The layout of this process's environment. When it is faulty, the
// system instance's layout under TENON_ROOT: callers that must refuse a
// faulty environment (the daemon) check currentLayoutError() first.
Layout currentLayout();
std::string currentLayoutError();  // empty when the environment is sound

// $TENON_ROOT, "" when unset: the root of what is installed.
std::string platformRoot();

// The variables (NAME=value) that make a child process find this process's
// instance: TENON_ROOT when set, and for a per-user instance TENON_INSTANCE
// and the XDG variables its layout was read from. A child given these and
// nothing else of ours reaches the same services.
std::vector<std::string> instanceEnvironment();

}  // namespace paths
