#pragma once

// A changed copy of a small dictionary, used for annotation changes.

#include <optional>
#include <string_view>

#include "platform/value/Value.h"

namespace tn {

// A copy of `receiver` with `key` set to `value`, or with `key` removed when
// `value` is none (std::nullopt or a null Value). `receiver` is never changed.
Dictionary dictionaryChanging(const Dictionary& receiver, std::string_view key, const std::optional<Value>& value);

}  // namespace tn
