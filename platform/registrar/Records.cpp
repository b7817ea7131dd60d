#include "platform/registrar/Records.h"

namespace registrar {

std::optional<std::string> PlugInRecord::extensionPointIdentifier() const {
  if (const std::string* point = fields_.plugInDictionary[kExtensionPointIdentifierKey].string()) return *point;
  return std::nullopt;
}

bool PlugInRecord::isAppExtension() const { return fields_.bundlePath.ends_with(kAppExtensionSuffix); }

bool PlugInRecord::isData() const {
  const std::string* protocol = fields_.plugInDictionary[kExtensionProtocolKey].string();
  return protocol != nullptr && *protocol == kDataProtocol;
}

}  // namespace registrar
