#include "platform/warden/ActivationOverlay.h"

#include <cerrno>

#include <fmt/format.h>

#include "platform/warden/SandboxProfile.h"
#include "platform/warden/WardenError.h"

namespace warden {
namespace {

tn::Error invalid(std::string message) { return makeWardenError(EINVAL, "activation overlay: " + std::move(message)); }

bool validVariableName(const std::string& name) {
  return !name.empty() && name.find('=') == std::string::npos && name.find('\0') == std::string::npos;
}

tn::Result<void> readEnvironment(const tn::Value& variables, ActivationOverlay& overlay) {
  if (variables.isNull()) return {};
  if (!variables.isDictionary()) return invalid("\"EnvironmentVariables\" is not a dictionary");
  std::size_t bytes = 0;
  for (const auto& [name, value] : *variables.dictionary()) {
    if (!validVariableName(name)) return invalid(fmt::format("environment variable name {:?} is not valid", name));
    if (!value.isString()) return invalid(fmt::format("environment variable {} is not a string", name));
    const std::string& text = *value.string();
    if (text.find('\0') != std::string::npos) return invalid(fmt::format("environment variable {} holds NUL", name));
    bytes += name.size() + text.size() + 2;
    overlay.environment.emplace_back(name, text);
  }
  if (overlay.environment.size() > kMaxEnvironmentVariables) {
    return invalid(fmt::format("{} environment variables exceed the limit of {}", overlay.environment.size(),
                               kMaxEnvironmentVariables));
  }
  if (bytes > kMaxEnvironmentBytes) {
    return invalid(fmt::format("the environment's {} bytes exceed the limit of {}", bytes, kMaxEnvironmentBytes));
  }
  return {};
}

}  // namespace

tn::Result<ActivationOverlay> ActivationOverlay::parse(const tn::Value& value) {
  if (!value.isDictionary()) return invalid("not a dictionary");
  const tn::Value& packageType = value["BNBundlePackageType"];
  if (!packageType.isString() || *packageType.string() != kPackageType) {
    return invalid(fmt::format("\"BNBundlePackageType\" is {}, not \"{}\"", packageType.description(), kPackageType));
  }
  const tn::Value& service = value["RelayService"];
  if (!service.isDictionary()) return invalid("\"RelayService\" is not a dictionary");
  ActivationOverlay overlay;
  if (tn::Result<void> read = readEnvironment(service["EnvironmentVariables"], overlay); !read.ok()) {
    return read.error();
  }
  const tn::Value& profile = service["_SandboxProfile"];
  if (!profile.isNull()) {
    if (!profile.isString() || !isProfileName(*profile.string())) {
      return invalid(fmt::format("\"_SandboxProfile\" {} is not a profile name", profile.description()));
    }
    overlay.sandboxProfile = *profile.string();
  }
  return overlay;
}

}  // namespace warden
