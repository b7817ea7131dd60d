#pragma once

// The user's locale and the language fallback the registry localizes by.
//
// A locale such as "de_DE.UTF-8@euro" gives the language chain
// ["de_DE", "de"]: codeset and modifier are dropped, then the region.
// Localized names come from Localized/<language>/InfoManifest.manifest of the
// first language in the chain that has the key, else from Info.manifest
// itself; strings tables fall back the same way, ending with
// Localized/Base/<table>.manifest (docs/registrar.md).

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Value.h"

namespace registrar {

// The language directory that ends every strings-table fallback.
inline constexpr std::string_view kBaseLanguage = "Base";

// "de_DE.UTF-8@euro" -> ["de_DE", "de"]; "de" -> ["de"]; "C", "POSIX" and ""
// -> []. Only names fit to be a directory entry are kept.
std::vector<std::string> languageChain(std::string_view locale);

struct LocalizedNames {
  std::optional<std::string> name;       // display name
  std::optional<std::string> shortName;  // bundle name
};

// The names of a bundle for the chain. localizations maps a language to the
// dictionary of its InfoManifest.manifest; info is the Info.manifest. The
// name is the first "BNBundleDisplayName" along chain-then-manifest, else the
// first "BNBundleName", else the bundle directory's name without extension;
// the short name prefers "BNBundleName" the same way, then the name.
LocalizedNames localizedNames(const tn::Value& localizations, const std::vector<std::string>& chain,
                              const tn::Value& info, std::string_view bundlePath);

}  // namespace registrar
