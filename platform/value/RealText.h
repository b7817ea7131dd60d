#pragma once

// Internal to the document writers: the text of a double.

#include <string>

namespace tn::document {

// Appends the shortest decimal text that reads back to exactly d ("0.1",
// "-0", "1e+300", "5e-324"), or "nan", "inf", "-inf".
void appendRealText(std::string& out, double d);

}  // namespace tn::document
