// Fuzzes the JSON document reader. Whatever it accepts must survive the XML
// writer (written, read, identical) and the JSON writer too: a value read
// from JSON holds nothing JSON cannot carry, so its JSON text must read back
// identical as well.

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

void expectSurvives(const tn::Value& value, tn::Result<std::string> written, const char* encoding) {
  if (!written) failure(encoding, "an accepted document cannot be written: " + written.error().localizedDescription());
  tn::Result<tn::Value> reread = tn::readDocument(*written, "written");
  if (!reread) failure(encoding, "a written document cannot be read: " + reread.error().localizedDescription());
  if (!tn::Value::identical(value, *reread))
    failure(encoding, "the written document reads differently: " + value.description() + "\n" + reread->description());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  tn::Result<tn::Value> read = tn::readDocument(bytes, "fuzz.json", tn::DocumentEncoding::Json);
  if (!read) return 0;
  expectSurvives(*read, tn::writeXmlDocument(*read), "XML");
  expectSurvives(*read, tn::writeJsonDocument(*read), "JSON");
  return 0;
}
