#pragma once

// Structured-value documents: how Info.manifest files, the annotation file,
// preferences and SDK dictionaries are stored. A document holds one tn::Value
// of any kind (usually a dictionary).
//
// Two encodings are read: XML in Tenon's own vocabulary (what the system
// writes; lossless for every tn::Value) and JSON (what plug-in authors write
// by hand). docs/documents.md describes both for authors; this header states
// the C++ contract.
//
// Every document is untrusted input. Readers refuse anything larger than
// kMaxDocumentSize before parsing, containers nested deeper than
// kMaxDocumentDepth, DOCTYPEs and every entity reference but the five
// predefined ones and character references (nothing is ever expanded or
// fetched), invalid UTF-8 anywhere, and everything outside the vocabulary.
// Failures are values, never exceptions: a tn::Error of domain
// kDocumentErrorDomain whose message reads "Info.manifest:12: unknown element
// <strng>", that is "<name>:<line>: <reason>", on one line.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tn {

inline constexpr std::string_view kDocumentErrorDomain = "Document";

// Error codes (tn::Error::code() of domain kDocumentErrorDomain).
enum class DocumentErrorCode : int64_t {
  Unreadable = 1,       // the file could not be opened or read
  TooLarge = 2,         // more than kMaxDocumentSize bytes
  Malformed = 3,        // not well-formed XML or JSON, invalid UTF-8, DOCTYPE, unknown entity
  TooDeep = 4,          // containers nested deeper than kMaxDocumentDepth
  Invalid = 5,          // well-formed, but not a document of the vocabulary (unknown element,
                        // bad number, duplicate key, ...)
  Unrepresentable = 6,  // a writer met a value its encoding cannot hold
};

// True when error is a document error with that code.
bool isDocumentError(const Error& error, DocumentErrorCode code);

// Inputs larger than this are refused without being parsed.
inline constexpr size_t kMaxDocumentSize = 16 * 1024 * 1024;

// Arrays and dictionaries may nest this deep: a root container is at depth 1,
// and a container at depth 65 is refused (by the writers too, so that nothing
// is written that no reader accepts).
inline constexpr int kMaxDocumentDepth = 64;

enum class DocumentEncoding { Xml, Json };

// The encoding of bytes: XML when the first byte that is not whitespace (after
// a UTF-8 byte order mark, if any) is '<', JSON otherwise.
DocumentEncoding detectDocumentEncoding(std::string_view bytes);

// Reads a document in the encoding detectDocumentEncoding() finds. Strings
// and keys are UTF-8, except those an XML document carries base64-encoded
// (<str encoding="base64">), which may hold any bytes: the writer uses that
// form for strings XML cannot carry, and they read back byte for byte. name is
// what error messages call the input (usually its path); it is not opened.
Result<Value> readDocument(std::string_view bytes, std::string_view name);

// Reads a document that must be in the given encoding.
Result<Value> readDocument(std::string_view bytes, std::string_view name, DocumentEncoding encoding);

// Reads the file at path (checking its size before reading it) and then as
// readDocument(bytes, path). An unreadable file gives "<path>: cannot read:
// <reason>" with code Unreadable.
Result<Value> readDocumentFile(const std::string& path);

// The XML document of value: declaration, root element, two-space
// indentation, a final newline. Reading it back gives a value identical to
// value (Value::identical). Fails (Unrepresentable) only for a date without
// an ISO 8601 form (hasISO8601Form) or containers nested deeper than
// kMaxDocumentDepth; the message names where, as a path of keys and indices.
Result<std::string> writeXmlDocument(const Value& value);

// The JSON text of value, pretty-printed with two spaces and a final newline.
// JSON holds less than a tn::Value, so this is lossy: data becomes a base64
// string, a date its ISO 8601 string, a UUID its canonical string, an
// unsigned integer up to INT64_MAX reads back as a signed one, and a
// non-integral-looking double keeps a ".0" so it reads back as a double.
// Fails (Unrepresentable) for NaN and infinities, strings or keys that are not
// valid UTF-8, dates without an ISO 8601 form, and nesting deeper than
// kMaxDocumentDepth.
Result<std::string> writeJsonDocument(const Value& value);

}  // namespace tn
