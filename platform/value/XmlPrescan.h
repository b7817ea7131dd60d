#pragma once

// Internal to the XML reader: the check of the raw bytes that runs before
// the XML parser sees them. The parser would quietly keep what this refuses,
// so refusing it here is what makes the reader strict:
//
//  - every byte is valid UTF-8 and every character is one XML 1.0 allows
//    (no NUL, no control characters but tab, LF and CR, no U+FFFE/U+FFFF);
//  - no DOCTYPE or other "<!" declaration (so no entity can be declared);
//  - every '&' in text and attribute values begins &amp; &lt; &gt; &quot;
//    &apos; or a character reference to an XML character ("&foo;" and a
//    bare '&' are errors; inside comments and CDATA sections '&' is text);
//  - no '<' inside an attribute value.

#include "platform/value/DocumentInput.h"
#include "platform/value/Result.h"

namespace tn::document {

// Success, or a Malformed error naming the line of the first offence.
Result<void> prescanXml(const DocumentInput& input);

}  // namespace tn::document
