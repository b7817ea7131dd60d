// Fuzzes lint's checks of a manifest's keys (tnctl lint, and tnctl add when
// the registrar refuses a bundle, which may be anybody's): any manifest
// text that reads as a document is checked without crashing, and every
// finding is a non-empty message.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "platform/value/Document.h"
#include "tools/tnctl/ManifestLint.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  tn::Result<tn::Value> read = tn::readDocument(bytes, "Info.manifest", tn::DocumentEncoding::Json);
  if (!read) return 0;
  for (const tnctl::LintFinding& finding : tnctl::checkManifestKeys(*read)) {
    if (finding.message.empty()) {
      std::fprintf(stderr, "an empty finding for %s\n", read->description().c_str());
      std::abort();
    }
  }
  return 0;
}
