#pragma once

// RegistrarLookup: the plug-in model's two registry questions (SDK
// dictionaries of extension points, localized strings tables) answered by
// the registrar of this machine (platform/registrar). The daemon uses it
// over its own read-write registrar; tnctl over a read-only one.

#include <memory>

#include "libtenon/model/TNRegistryLookup.h"
#include "platform/registrar/Registrar.h"

namespace tn {

class RegistrarLookup final : public TNRegistryLookup {
 public:
  explicit RegistrarLookup(std::shared_ptr<const registrar::Registrar> registrar);

  std::optional<Dictionary> sdkDictionary(std::string_view extensionPointIdentifier) const override;
  std::optional<LocalizedStrings> localizedStrings(const URL& plugInBundle, std::string_view table,
                                                   const std::set<std::string, std::less<>>& keys) const override;

 private:
  const std::shared_ptr<const registrar::Registrar> registrar_;
};

}  // namespace tn
