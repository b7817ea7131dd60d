#include "libtenon/registrar/RegistrarLookup.h"

namespace tn {

RegistrarLookup::RegistrarLookup(std::shared_ptr<const registrar::Registrar> registrar)
    : registrar_(std::move(registrar)) {}

std::optional<Dictionary> RegistrarLookup::sdkDictionary(std::string_view extensionPointIdentifier) const {
  const registrar::ExtensionPointPtr point = registrar_->extensionPoint(extensionPointIdentifier);
  if (!point || !point->sdkDictionary().isDictionary()) return std::nullopt;
  return *point->sdkDictionary().dictionary();
}

std::optional<TNRegistryLookup::LocalizedStrings> RegistrarLookup::localizedStrings(
    const URL& plugInBundle, std::string_view table, const std::set<std::string, std::less<>>& keys) const {
  // The registrar's strings map is the model's type.
  return registrar_->localizedStrings(plugInBundle.path(), table, keys);
}

}  // namespace tn
