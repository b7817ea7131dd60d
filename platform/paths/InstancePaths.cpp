#include "platform/paths/InstancePaths.h"

#include <cstdlib>

namespace paths {
namespace {

std::string variable(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr ? value : "";
}

bool isAbsolute(const std::string& path) { return !path.empty() && path.front() == '/'; }

// An XDG base directory: the variable when absolute, else HOME/fallback.
std::optional<std::string> baseDirectory(const std::string& value, const std::string& home,
                                         std::string_view fallback) {
  if (isAbsolute(value)) return value;
  if (!isAbsolute(home)) return std::nullopt;
  return home + "/" + std::string(fallback);
}

// Where an instance keeps each kind of file; the layout names every file.
struct Directories {
  std::string runtime;  // sockets and notifications
  std::string state;    // what it keeps for its users
  std::string cache;    // what it can rebuild
  std::string config;   // its settings
  std::string annotationFile;
};

Layout layoutIn(Instance instance, const std::string& root, const Directories& directories) {
  Layout layout;
  layout.instance = instance;
  layout.root = root;
  layout.relayDirectory = directories.runtime + "/relay";
  layout.notificationDirectory = directories.runtime + "/notify";
  layout.annotationFile = directories.annotationFile;
  layout.preferencesDirectory = directories.state + "/prefs";
  layout.containersDirectory = directories.state + "/containers";
  layout.sandboxKeyFile = directories.state + "/sandbox.key";
  layout.consentStore = directories.state + "/consent.manifest";
  layout.registrarStore = directories.cache + "/registrar.sqlite3";
  layout.configurationFile = directories.config + "/tenond.manifest";
  return layout;
}

// The machine's instance: everything under the platform root, the
// annotation file in /var/db.
Layout systemLayout(const std::string& root) {
  const std::string kept = root + "/var/lib/tenon";
  return layoutIn(Instance::System, root,
                  {root + "/run/tenon", kept, kept, root + "/etc/tenon", root + "/var/db/Tenon-Annotations"});
}

LayoutResult userLayout(const Environment& environment) {
  if (!isAbsolute(environment.runtimeDirectory)) {
    return {std::nullopt, "a per-user instance needs XDG_RUNTIME_DIR, an absolute path; it is \"" +
                              environment.runtimeDirectory + "\""};
  }
  const std::optional<std::string> state = baseDirectory(environment.stateHome, environment.home, ".local/state");
  const std::optional<std::string> cache = baseDirectory(environment.cacheHome, environment.home, ".cache");
  const std::optional<std::string> config = baseDirectory(environment.configHome, environment.home, ".config");
  if (!state || !cache || !config) {
    return {std::nullopt, "a per-user instance needs XDG_STATE_HOME, XDG_CACHE_HOME and XDG_CONFIG_HOME, or "
                          "an absolute HOME to find them under; HOME is \"" + environment.home + "\""};
  }
  const std::string kept = *state + "/tenon";
  return {layoutIn(Instance::User, environment.root,
                   {environment.runtimeDirectory + "/tenon", kept, *cache + "/tenon", *config + "/tenon",
                    kept + "/Tenon-Annotations"}),
          ""};
}

}  // namespace

Environment Environment::current() {
  Environment environment;
  environment.root = variable("TENON_ROOT");
  environment.instance = variable(kInstanceVariable);
  environment.runtimeDirectory = variable("XDG_RUNTIME_DIR");
  environment.stateHome = variable("XDG_STATE_HOME");
  environment.cacheHome = variable("XDG_CACHE_HOME");
  environment.configHome = variable("XDG_CONFIG_HOME");
  environment.home = variable("HOME");
  return environment;
}

std::optional<Instance> instanceNamed(std::string_view name) {
  if (name.empty() || name == "system") return Instance::System;
  if (name == "user") return Instance::User;
  return std::nullopt;
}

LayoutResult layoutFor(const Environment& environment) {
  const std::optional<Instance> instance = instanceNamed(environment.instance);
  if (!instance) {
    return {std::nullopt, std::string(kInstanceVariable) + " is \"" + environment.instance +
                              "\"; it must be \"system\" or \"user\""};
  }
  if (*instance == Instance::System) return {systemLayout(environment.root), ""};
  return userLayout(environment);
}

Layout currentLayout() {
  const Environment environment = Environment::current();
  LayoutResult result = layoutFor(environment);
  return result.layout ? std::move(*result.layout) : systemLayout(environment.root);
}

std::string currentLayoutError() { return layoutFor(Environment::current()).error; }

std::string platformRoot() { return variable("TENON_ROOT"); }

namespace {
constexpr const char* kUserInstanceVariables[] = {"XDG_RUNTIME_DIR", "XDG_STATE_HOME", "XDG_CACHE_HOME",
                                                  "XDG_CONFIG_HOME", "HOME"};
}  // namespace

std::vector<std::string> instanceEnvironment() {
  std::vector<std::string> environment;
  if (const std::string root = platformRoot(); !root.empty()) environment.push_back("TENON_ROOT=" + root);
  if (currentLayout().instance != Instance::User) return environment;
  environment.push_back(std::string(kInstanceVariable) + "=user");
  for (const char* name : kUserInstanceVariables) {
    if (const std::string value = variable(name); !value.empty()) environment.push_back(name + ("=" + value));
  }
  return environment;
}

}  // namespace paths
