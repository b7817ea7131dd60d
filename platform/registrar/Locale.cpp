#include "platform/registrar/Locale.h"

#include <cstdlib>

#include "platform/bundle/BundleLayout.h"
#include "platform/registrar/Records.h"

namespace registrar {
namespace {

std::optional<std::string> firstString(const tn::Value& localizations, const std::vector<std::string>& chain,
                                       const tn::Value& info, std::string_view key) {
  for (const std::string& language : chain) {
    if (const std::string* found = localizations[language][key].string()) return *found;
  }
  if (const std::string* found = info[key].string()) return *found;
  return std::nullopt;
}

std::string directoryStem(std::string_view bundlePath) {
  std::string_view name = bundlePath.substr(bundlePath.rfind('/') + 1);
  const size_t dot = name.rfind('.');
  if (dot != std::string_view::npos && dot > 0) name = name.substr(0, dot);
  return std::string(name);
}

}  // namespace

std::vector<std::string> languageChain(std::string_view locale) {
  locale = locale.substr(0, locale.find_first_of(".@"));
  std::vector<std::string> chain;
  if (locale.empty() || locale == "C" || locale == "POSIX") return chain;
  if (bundle::isPlainFileName(locale)) chain.emplace_back(locale);
  const size_t underscore = locale.find('_');
  if (underscore != std::string_view::npos && underscore > 0) chain.emplace_back(locale.substr(0, underscore));
  return chain;
}

LocalizedNames localizedNames(const tn::Value& localizations, const std::vector<std::string>& chain,
                              const tn::Value& info, std::string_view bundlePath) {
  const std::optional<std::string> display = firstString(localizations, chain, info, kBundleDisplayNameKey);
  const std::optional<std::string> name = firstString(localizations, chain, info, kBundleNameKey);
  LocalizedNames names;
  names.name = display ? display : name;
  if (!names.name) names.name = directoryStem(bundlePath);
  names.shortName = name ? name : names.name;
  return names;
}

}  // namespace registrar
