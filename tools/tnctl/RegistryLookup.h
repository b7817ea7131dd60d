#pragma once

// Where tnctl gets the registry's answers that the plug-in model asks for
// (SDK dictionaries of extension points, strings tables of plug-ins).

#include <memory>
#include <string>

#include "libtenon/model/TNRegistryLookup.h"

namespace tnctl {

// The registry lookup tnctl's commands use. For now it reads the same files
// the registrar reads, straight from disk:
//   SDK dictionaries  <extensionPoints>/<identifier>.manifest, by default
//                     $TENON_ROOT/usr/share/tenon/extension-points
//   strings tables    <plug-in bundle>/Localized/<language>/<table>.manifest
// Languages are tried in the order of the current locale's fallbacks
// (platform/locale: "de_AT", then "de"), then "Base"; for each key the first
// table that has a string for it wins.
std::unique_ptr<tn::TNRegistryLookup> makeRegistryLookup(const std::string& extensionPoints = {});

}  // namespace tnctl
