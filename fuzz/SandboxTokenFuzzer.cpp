// Fuzzes sandbox extension tokens: parsing and consuming arbitrary text.
// Nothing but a token signed with this machine's key may be consumed, so an
// input the fuzzer makes up must always be refused; and whatever parses must
// be rebuilt, signed, into a token that parses to the same fields.

#include <stdlib.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <string_view>

#include "platform/sandbox/Extensions.h"

namespace {

sandbox::SandboxKey otherKey() {
  sandbox::SandboxKey key;
  key.fill(0x5A);
  return key;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // A private root with a key, so that consuming checks signatures.
  static std::string root = "/tmp/tenon-fuzz-token-XXXXXX";
  if (::mkdtemp(root.data()) == nullptr) std::abort();
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
  });
  ::setenv("TENON_ROOT", root.c_str(), 1);
  if (!sandbox::loadOrCreateSandboxKey()) std::abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  tn::Result<int64_t> consumed = sandbox::consumeExtension(text);
  if (consumed) {
    std::fprintf(stderr, "a made-up token was consumed: %.*s\n", static_cast<int>(size), text.data());
    std::abort();
  }
  tn::Result<sandbox::ExtensionToken> parsed = sandbox::parseExtensionToken(text);
  if (!parsed) return 0;
  const std::string rebuilt =
      sandbox::makeExtensionToken(parsed->kind, parsed->extensionClass, parsed->subject, otherKey());
  tn::Result<sandbox::ExtensionToken> reparsed = sandbox::parseExtensionToken(rebuilt);
  if (!reparsed || reparsed->kind != parsed->kind || reparsed->extensionClass != parsed->extensionClass ||
      reparsed->subject != parsed->subject || !sandbox::hasValidSignature(*reparsed, otherKey())) {
    std::fprintf(stderr, "a parsed token does not survive rebuilding: %.*s\n", static_cast<int>(size), text.data());
    std::abort();
  }
  return 0;
}
