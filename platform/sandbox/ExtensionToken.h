#pragma once

// The text of a sandbox extension token, and its signature.
//
//   tnx1;<kind>;<class>;<subject>;<signature>
//
// kind is "file" (subject: an absolute path) or "service" (subject: an IPC
// service name); class is the extension class the issuer named. Class and
// subject are percent-encoded: every byte outside A-Z a-z 0-9 - . _ ~ / is
// written as %XX (upper-case hex), so ';' never occurs inside a field and any
// path survives. signature is 64 lower-case hex digits: HMAC-SHA-256, with the
// per-machine key (SandboxKey.h), of the token's text up to the last ';'.
//
// Tokens are untrusted input: parseExtensionToken accepts exactly this form
// and nothing longer than kMaxExtensionTokenSize.

#include <optional>
#include <string>
#include <string_view>

#include "platform/sandbox/SandboxKey.h"
#include "platform/value/Result.h"

namespace sandbox {

inline constexpr size_t kMaxExtensionTokenSize = 16 * 1024;

enum class ExtensionKind { File, Service };

struct ExtensionToken {
  ExtensionKind kind = ExtensionKind::File;
  std::string extensionClass;
  std::string subject;    // canonical path or service name
  std::string signature;  // 64 lower-case hex digits
  std::string signedText;  // the token's text before ";<signature>"
};

// The signed token for kind, class and subject.
std::string makeExtensionToken(ExtensionKind kind, std::string_view extensionClass, std::string_view subject,
                               const SandboxKey& key);

// The token's fields, or an EINVAL error (domain kSandboxErrorDomain) whose
// message says what is wrong: wrong field count, unknown version or kind,
// bad escape, empty or relative subject, NUL inside a field, bad signature
// text, too long. Checks the form only, not the signature.
tn::Result<ExtensionToken> parseExtensionToken(std::string_view text);

// True when token carries the signature key makes for it (constant-time).
bool hasValidSignature(const ExtensionToken& token, const SandboxKey& key);

}  // namespace sandbox
