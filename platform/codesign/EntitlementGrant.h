#pragma once

// When an entitlement's value grants what it names.

#include "platform/value/Value.h"

namespace codesign {

// True when value is present (not null) and not equal to false. Numbers
// compare by value, so 0 and 0.0 deny like false does, and 1 grants like
// true; strings, data, arrays and dictionaries grant whatever they hold
// (an empty array too: its presence is the grant).
bool entitlementIsGranted(const tn::Value& value);

}  // namespace codesign
