// Fuzzes what clients can make the annotation store keep: the input is one
// CBOR item, read as a request's "annotations" dictionary is, whose entries
// (annotation key to annotation dictionary) are stored one by one. Whatever
// the store accepts, the text it would save must read back as the map in
// memory: no stored value may make the file unreadable or a save fail, and
// the joined text must be the document writer's own.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>

#include "platform/value/Cbor.h"
#include "platform/value/Document.h"
#include "platform/value/MessageValue.h"
#include "tenond/database/TNDAnnotationStore.h"

namespace {

[[noreturn]] void failure(const char* what, const tn::Value& input) {
  std::fprintf(stderr, "%s\n%s\n", what, input.description().c_str());
  std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tn::Result<tn::Value> decoded = tn::decodeCbor(std::span<const uint8_t>(data, size));
  if (!decoded.ok()) return 0;
  const tn::Value input = tn::convertMessageToMemory(*decoded);
  const tn::Dictionary* entries = input.dictionary();
  if (!entries) return 0;

  // A file that is never written: the directory does not exist.
  tnd::TNDAnnotationStore store(std::string("/nonexistent-tenon-fuzz/Tenon-Annotations"));
  for (const auto& [key, value] : *entries) {
    const tn::Dictionary* annotation = value.dictionary();
    (void)store.setAnnotation(annotation ? std::optional<tn::Dictionary>(*annotation) : std::nullopt, key,
                              tnd::TNDAnnotationStore::Save::Deferred);
  }
  if (store.storedSize() > tnd::TNDAnnotationStore::kMaxStoreSize) failure("the store passed its bound", input);
  const tn::Result<std::string> text = store.fileText();
  if (!text.ok()) failure("a save would fail", input);
  const tn::Value document(tn::Dictionary{{"version", tn::Value(tnd::TNDAnnotationStore::kDatabaseVersion)},
                                          {"data", tn::Value(store.annotations())}});
  if (*text != *tn::writeXmlDocument(document)) failure("the joined text is not the writer's", input);
  // Read back, the file gives a map that is saved as the same text (the
  // text form keeps everything but the sign of a NaN).
  const tn::Result<tn::Value> read = tn::readDocument(*text, "annotations");
  if (!read.ok()) failure("the saved text does not read back", input);
  if (*tn::writeXmlDocument(*read) != *text) failure("the saved text reads back as another map", input);
  return 0;
}
