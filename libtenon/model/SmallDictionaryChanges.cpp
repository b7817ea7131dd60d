#include "libtenon/model/SmallDictionaryChanges.h"

namespace tn {

Dictionary dictionaryChanging(const Dictionary& receiver, std::string_view key, const std::optional<Value>& value) {
  Dictionary copy = receiver;
  if (!value || value->isNull())
    copy.erase(key);
  else
    copy.set(std::string(key), *value);
  return copy;
}

}  // namespace tn
