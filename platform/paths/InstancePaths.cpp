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

Layout systemLayout(const std::string& root) {
  Layout layout;
  layout.instance = Instance::System;
  layout.root = root;
  layout.relayDirectory = root + "/run/tenon/relay";
  layout.notificationDirectory = root + "/run/tenon/notify";
  layout.annotationFile = root + "/var/db/Tenon-Annotations";
  layout.preferencesDirectory = root + "/var/lib/tenon/prefs";
  layout.registrarStore = root + "/var/lib/tenon/registrar.sqlite3";
  layout.containersDirectory = root + "/var/lib/tenon/containers";
  layout.sandboxKeyFile = root + "/var/lib/tenon/sandbox.key";
  layout.consentStore = root + "/var/lib/tenon/consent.manifest";
  layout.configurationFile = root + "/etc/tenon/tenond.manifest";
  return layout;
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
  Layout layout = systemLayout(environment.root);
  layout.instance = Instance::User;
  const std::string runtime = environment.runtimeDirectory + "/tenon";
  const std::string kept = *state + "/tenon";
  layout.relayDirectory = runtime + "/relay";
  layout.notificationDirectory = runtime + "/notify";
  layout.annotationFile = kept + "/Tenon-Annotations";
  layout.preferencesDirectory = kept + "/prefs";
  layout.containersDirectory = kept + "/containers";
  layout.sandboxKeyFile = kept + "/sandbox.key";
  layout.consentStore = kept + "/consent.manifest";
  layout.registrarStore = *cache + "/tenon/registrar.sqlite3";
  layout.configurationFile = *config + "/tenon/tenond.manifest";
  return {layout, ""};
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
