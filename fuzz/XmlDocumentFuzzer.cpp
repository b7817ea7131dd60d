// Fuzzes the XML document reader. Whatever it accepts must survive the XML
// writer: written, read again, and identical (kinds, -0.0, NaN, order-free
// dictionaries), and written again to the same text (so order is kept).

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "platform/value/Document.h"

namespace {

[[noreturn]] void failure(const char* what, const std::string& detail) {
  std::fprintf(stderr, "%s\n%s\n", what, detail.c_str());
  std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  tn::Result<tn::Value> read = tn::readDocument(bytes, "fuzz.xml", tn::DocumentEncoding::Xml);
  if (!read) return 0;
  tn::Result<std::string> written = tn::writeXmlDocument(*read);
  if (!written) failure("an accepted document cannot be written", written.error().localizedDescription());
  tn::Result<tn::Value> reread = tn::readDocument(*written, "written.xml");
  if (!reread) failure("a written document cannot be read", reread.error().localizedDescription() + "\n" + *written);
  if (!tn::Value::identical(*read, *reread))
    failure("the written document reads differently", read->description() + "\n" + reread->description());
  tn::Result<std::string> rewritten = tn::writeXmlDocument(*reread);
  if (!rewritten || *rewritten != *written) failure("writing is not stable", *written);
  return 0;
}
