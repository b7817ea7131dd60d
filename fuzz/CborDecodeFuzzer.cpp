// Feeds arbitrary bytes to the two CBOR entry points that read untrusted
// input: message bodies (the relay) and typed encodings (forms in replies).
// Besides crashes and sanitizer reports, it checks that whatever the decoder
// accepts encodes again and decodes to the very same value.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>

#include "platform/value/Cbor.h"
#include "platform/value/TypedEncoding.h"

namespace {

void failDifferential(const char* what, const tn::Value& first, const tn::Value& second) {
  std::fprintf(stderr, "%s\nfirst:  %s\nsecond: %s\n", what, first.description().c_str(),
               second.description().c_str());
  std::abort();
}

void checkStable(const tn::Value& decoded, tn::CborDialect dialect) {
  tn::Result<tn::Value> again = tn::decodeCbor(tn::encodeCbor(decoded, dialect), dialect);
  if (!again.ok()) {
    std::fprintf(stderr, "re-encoding was refused: %s\n", again.error().description().c_str());
    failDifferential("accepted value does not survive re-encoding", decoded, tn::Value());
  }
  if (!tn::Value::identical(*again, decoded)) failDifferential("re-encoding changed the value", decoded, *again);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::span<const uint8_t> input(data, size);

  tn::Result<tn::Value> body = tn::decodeMessageBody(input);
  if (body.ok()) {
    if (!body->isDictionary()) failDifferential("message body is not a dictionary", *body, tn::Value());
    checkStable(*body, tn::CborDialect::Wire);
  }

  tn::Result<tn::Value> typed = tn::decodeTyped(tn::Value(tn::Bytes(input.begin(), input.end())));
  if (typed.ok()) {
    checkStable(*typed, tn::CborDialect::Typed);
    // The typed encoding of what was read is lossless, however it arrived.
    tn::Result<tn::Value> back = tn::decodeTyped(tn::encodeTyped(*typed));
    if (!back.ok() || !tn::Value::identical(*back, *typed))
      failDifferential("typed encoding is not lossless", *typed, back.ok() ? *back : tn::Value());
  }
  return 0;
}
