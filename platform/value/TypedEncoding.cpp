#include "platform/value/TypedEncoding.h"

namespace tn {

Value encodeTyped(const Value& value) {
  return Value(encodeCbor(value, CborDialect::Typed));
}

Result<Value> decodeTyped(const Value& encoded) {
  const Bytes* bytes = encoded.data();
  if (!bytes)
    return Error(std::string(kCborErrorDomain), static_cast<int64_t>(CborErrorCode::NotTypedData),
                 fmt::format("typed encoding must be a data value, found {}",
                             Value::kindName(encoded.kind())));
  return decodeCbor(*bytes, CborDialect::Typed);
}

}  // namespace tn
