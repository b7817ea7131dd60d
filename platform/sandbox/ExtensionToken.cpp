#include "platform/sandbox/ExtensionToken.h"

#include "platform/value/PercentDecoding.h"

#include <cerrno>

#include <fmt/format.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

namespace sandbox {
namespace {

constexpr std::string_view kVersion = "tnx1";
constexpr std::string_view kFileKind = "file";
constexpr std::string_view kServiceKind = "service";
constexpr size_t kSignatureDigits = 64;
constexpr char kHexDigits[] = "0123456789ABCDEF";

bool isUnescaped(unsigned char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '.' ||
         c == '_' || c == '~' || c == '/';
}

void appendEscaped(std::string& out, std::string_view text) {
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (isUnescaped(byte)) {
      out += c;
    } else {
      out += '%';
      out += kHexDigits[byte >> 4];
      out += kHexDigits[byte & 0xF];
    }
  }
}


std::string hexSignature(std::string_view signedText, const SandboxKey& key) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()), reinterpret_cast<const unsigned char*>(signedText.data()),
       signedText.size(), digest, &length);
  static constexpr char kLowerHex[] = "0123456789abcdef";
  std::string hex;
  hex.reserve(length * 2);
  for (unsigned int i = 0; i < length; ++i) {
    hex += kLowerHex[digest[i] >> 4];
    hex += kLowerHex[digest[i] & 0xF];
  }
  return hex;
}

tn::Error malformed(std::string_view reason) {
  return tn::Error(std::string(kSandboxErrorDomain), EINVAL, fmt::format("malformed extension token: {}", reason));
}

}  // namespace

std::string makeExtensionToken(ExtensionKind kind, std::string_view extensionClass, std::string_view subject,
                               const SandboxKey& key) {
  std::string token;
  token.reserve(kVersion.size() + extensionClass.size() + subject.size() + kSignatureDigits + 16);
  token += kVersion;
  token += ';';
  token += kind == ExtensionKind::File ? kFileKind : kServiceKind;
  token += ';';
  appendEscaped(token, extensionClass);
  token += ';';
  appendEscaped(token, subject);
  const std::string signature = hexSignature(token, key);
  token += ';';
  token += signature;
  return token;
}

tn::Result<ExtensionToken> parseExtensionToken(std::string_view text) {
  if (text.size() > kMaxExtensionTokenSize) return malformed("too long");
  std::string_view fields[5];
  size_t count = 0;
  for (size_t start = 0;;) {
    const size_t end = text.find(';', start);
    if (count == std::size(fields)) return malformed("too many fields");
    fields[count++] = text.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start);
    if (end == std::string_view::npos) break;
    start = end + 1;
  }
  if (count != std::size(fields)) return malformed("too few fields");
  if (fields[0] != kVersion) return malformed("unknown version");

  ExtensionToken token;
  if (fields[1] == kFileKind) {
    token.kind = ExtensionKind::File;
  } else if (fields[1] == kServiceKind) {
    token.kind = ExtensionKind::Service;
  } else {
    return malformed("unknown kind");
  }
  std::optional<std::string> extensionClass = tn::percentDecode(fields[2]);
  std::optional<std::string> subject = tn::percentDecode(fields[3]);
  if (!extensionClass || !subject) return malformed("bad escape");
  if (extensionClass->empty()) return malformed("no extension class");
  if (subject->empty()) return malformed("no subject");
  if (extensionClass->find('\0') != std::string::npos || subject->find('\0') != std::string::npos) {
    return malformed("NUL inside a field");
  }
  if (token.kind == ExtensionKind::File && subject->front() != '/') return malformed("relative path");
  const std::string_view signature = fields[4];
  if (signature.size() != kSignatureDigits ||
      signature.find_first_not_of("0123456789abcdef") != std::string_view::npos) {
    return malformed("bad signature text");
  }
  token.extensionClass = std::move(*extensionClass);
  token.subject = std::move(*subject);
  token.signature = std::string(signature);
  token.signedText = std::string(text.substr(0, text.size() - signature.size() - 1));
  return token;
}

bool hasValidSignature(const ExtensionToken& token, const SandboxKey& key) {
  const std::string expected = hexSignature(token.signedText, key);
  return expected.size() == token.signature.size() &&
         CRYPTO_memcmp(expected.data(), token.signature.data(), expected.size()) == 0;
}

}  // namespace sandbox
