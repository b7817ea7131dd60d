#include "tools/tnctl/Arguments.h"

#include <cerrno>
#include <cstdlib>
#include <filesystem>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"

namespace tnctl {

uint64_t parseFlags(const std::string& text) {
  const bool hex = text.starts_with("0x") || text.starts_with("0X");
  const std::string digits = hex ? text.substr(2) : text;
  const bool allDigits = !digits.empty() && digits.find_first_not_of(hex ? "0123456789abcdefABCDEF" : "0123456789") ==
                                                std::string::npos;
  errno = 0;
  const unsigned long long value = allDigits ? std::strtoull(digits.c_str(), nullptr, hex ? 16 : 10) : 0;
  if (!allDigits || errno == ERANGE) fail(fmt::format("invalid flags: {}", text));
  return value;
}

tn::Value readValueArgument(const std::string& text, const std::string& what) {
  tn::Result<tn::Value> value = text.starts_with("@") ? tn::readDocumentFile(text.substr(1))
                                                      : tn::readDocument(text, what);
  if (!value) fail(value.error().localizedDescription());
  return std::move(value).value();
}

tn::Dictionary readDictionaryArgument(const std::string& text, const std::string& what) {
  tn::Value value = readValueArgument(text, what);
  if (!value.isDictionary()) fail(fmt::format("{} must be a dictionary", what));
  return *value.dictionary();
}

tn::UUID parseUUID(const std::string& text) {
  std::optional<tn::UUID> uuid = tn::UUID::parse(text);
  if (!uuid) fail(fmt::format("invalid UUID: {}", text));
  return *uuid;
}

std::vector<tn::UUID> parseUUIDs(const std::vector<std::string>& texts) {
  std::vector<tn::UUID> uuids;
  for (const std::string& text : texts) uuids.push_back(parseUUID(text));
  return uuids;
}

std::string absolutePath(const std::string& path) {
  std::error_code error;
  const std::filesystem::path absolute = std::filesystem::absolute(path, error);
  if (error) fail(fmt::format("{}: {}", path, error.message()));
  return absolute.string();
}

std::vector<std::string> absolutePaths(const std::vector<std::string>& paths) {
  std::vector<std::string> absolute;
  for (const std::string& path : paths) absolute.push_back(absolutePath(path));
  return absolute;
}

tn::PlugInsByPath parsePlugIns(const std::vector<std::string>& pairs) {
  tn::PlugInsByPath plugins;
  for (const std::string& pair : pairs) {
    const size_t equals = pair.find('=');
    if (equals == std::string::npos || equals + 1 == pair.size()) {
      fail(fmt::format("expected UUID=PATH, got: {}", pair));
    }
    plugins.emplace_back(absolutePath(pair.substr(equals + 1)), parseUUID(pair.substr(0, equals)));
  }
  return plugins;
}

tn::URL parseURLOrPath(const std::string& text) {
  if (!text.starts_with("/") && !text.starts_with(".")) {
    if (std::optional<tn::URL> url = tn::URL::parse(text)) return *url;
  }
  return tn::URL::fileURLWithPath(absolutePath(text));
}

}  // namespace tnctl
