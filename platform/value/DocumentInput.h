#pragma once

// Internal to the document readers: the bytes being read, the name error
// messages give them, and the one way a reader reports a problem, as
// "<name>:<line>: <reason>".

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/value/Document.h"

namespace tn::document {

class DocumentInput {
 public:
  // bytes and name must outlive this object.
  DocumentInput(std::string_view bytes, std::string_view name) : bytes_(bytes), name_(name) {}

  std::string_view bytes() const { return bytes_; }
  std::string_view name() const { return name_; }

  // The 1-based line holding the byte at offset; an offset at or past the end
  // is on the last line. A line ends with LF, CR LF, or a lone CR.
  size_t lineAt(size_t offset) const;

  // The offset of the first byte at or after offset that is not XML/JSON
  // whitespace (space, tab, CR, LF), or the end.
  size_t skipWhitespace(size_t offset) const;

  // "<name>:<line of offset>: <reason>".
  Error errorAt(size_t offset, DocumentErrorCode code, std::string_view reason) const;

 private:
  std::string_view bytes_;
  std::string_view name_;
};

// A document-domain error with the given message, as is.
Error documentError(DocumentErrorCode code, std::string message);

// text in double quotes with control characters escaped (\n, \u0001), cut
// after 60 bytes with "...", for naming keys and literals in messages.
std::string quotedForMessage(std::string_view text);

inline bool isDocumentWhitespace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

}  // namespace tn::document
