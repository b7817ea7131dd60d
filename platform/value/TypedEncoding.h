#pragma once

// The typed encoding: a lossless way to carry one tn::Value inside one
// message value. Plug-in forms travel this way in protocol-version-3 replies,
// because the plain wire mapping turns a non-negative int64 into a uint64
// and a form must come back exactly as it was registered.
//
// The typed encoding of v is a data value holding the CBOR of v in
// CborDialect::Typed: the wire mapping plus a private tag
// (kCborTypedIntegerTag) around every non-negative int64. Being a byte
// string, it passes through any CBOR decoder untouched, the private tag never
// reaches a peer that does not ask for it, and its contents get their own
// nesting budget.

#include "platform/value/Cbor.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tn {

// A data value holding the typed encoding of value.
Value encodeTyped(const Value& value);

// The value whose typed encoding encoded is: identical (Value::identical) to
// the value encodeTyped was given. Fails with a CBOR-domain error when
// encoded is not a data value (CborErrorCode::NotTypedData) or its bytes are
// not exactly one item under the decoder's rules; any kind of top-level item
// is accepted.
Result<Value> decodeTyped(const Value& encoded);

}  // namespace tn
