#include "tools/tnctl/RegistryLookup.h"

#include <cstdlib>
#include <string>
#include <vector>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/locale/Locale.h"
#include "platform/paths/InstancePaths.h"

namespace tnctl {
namespace {

constexpr std::string_view kExtensionPointsDirectory = "/usr/share/tenon/extension-points";
constexpr std::string_view kManifestSuffix = ".manifest";
constexpr std::string_view kBaseLanguage = "Base";  // ends every fallback, as in the registrar

// The languages to try, most preferred first: the current locale's
// fallbacks ("de_AT", "de"), then the base localization.
std::vector<std::string> preferredLanguages() {
  std::vector<std::string> languages = locale::localeFallbacks(locale::currentLocale());
  languages.emplace_back(kBaseLanguage);
  std::erase_if(languages, [](const std::string& language) { return !bundle::isPlainFileName(language); });
  return languages;
}

class ManifestRegistryLookup : public tn::TNRegistryLookup {
 public:
  explicit ManifestRegistryLookup(std::string extensionPoints)
      : extensionPoints_(extensionPoints.empty() ? paths::platformRoot() + std::string(kExtensionPointsDirectory)
                                                 : std::move(extensionPoints)) {}

  std::optional<tn::Dictionary> sdkDictionary(std::string_view extensionPointIdentifier) const override {
    const std::string fileName = std::string(extensionPointIdentifier) + std::string(kManifestSuffix);
    if (!bundle::isPlainFileName(fileName)) return std::nullopt;
    const std::string path = extensionPoints_ + "/" + fileName;
    tn::Result<tn::Value> document = bundle::readManifestFile(path);
    if (!document || !document->isDictionary()) return std::nullopt;
    return *document->dictionary();
  }

  std::optional<LocalizedStrings> localizedStrings(const tn::URL& plugInBundle, std::string_view table,
                                                   const std::set<std::string, std::less<>>& keys) const override {
    const std::string fileName = std::string(table) + std::string(kManifestSuffix);
    if (!bundle::isPlainFileName(fileName)) return std::nullopt;
    const std::string localized = bundle::joinPath(plugInBundle.path(), bundle::kLocalizedDirectoryName);
    bool foundTable = false;
    LocalizedStrings strings;
    for (const std::string& language : preferredLanguages()) {
      tn::Result<tn::Value> document = bundle::readManifestFile(localized + "/" + language + "/" + fileName);
      if (!document || !document->isDictionary()) continue;
      foundTable = true;
      for (const std::string& key : keys) {
        const std::string* text = (*document)[key].string();
        if (text && !strings.contains(key)) strings.emplace(key, *text);
      }
    }
    if (!foundTable) return std::nullopt;
    return strings;
  }

 private:
  const std::string extensionPoints_;
};

}  // namespace

std::unique_ptr<tn::TNRegistryLookup> makeRegistryLookup(const std::string& extensionPoints) {
  return std::make_unique<ManifestRegistryLookup>(extensionPoints);
}

}  // namespace tnctl
