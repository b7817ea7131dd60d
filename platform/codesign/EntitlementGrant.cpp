#include "platform/codesign/EntitlementGrant.h"

namespace codesign {

bool entitlementIsGranted(const tn::Value& value) {
  if (value.isNull()) return false;
  return !(value == tn::Value(false));
}

}  // namespace codesign
