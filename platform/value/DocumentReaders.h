#pragma once

// Internal: the two readers behind readDocument(). Each takes the whole
// input (already checked against the size limit, byte order mark removed).

#include "platform/value/DocumentInput.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tn::document {

Result<Value> readXmlDocument(const DocumentInput& input);
Result<Value> readJsonDocument(const DocumentInput& input);

}  // namespace tn::document
