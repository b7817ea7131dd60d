#pragma once

// Where the type hierarchy comes from, and reading it.
//
// For each directory D of $XDG_DATA_DIRS (absolute entries only; unset or
// empty means /usr/local/share:/usr/share), the shared MIME database's
// $TENON_ROOT/D/mime/subclasses ("type parent" lines) and
// $TENON_ROOT/D/mime/aliases ("alias canonical" lines); an earlier
// directory's alias wins over a later one's. Then Tenon's own declarations,
// $TENON_ROOT/usr/share/tenon/types/*.manifest in name order, each a
// structured-value document
//
//   {"types": [{"identifier": "org.example.raw-photo", "parents": ["image/x-dcraw"]}, ...]}
//
// whose identifiers must not be MIME types (the MIME database speaks for
// those). docs/types.md describes this for authors.
//
// Everything read is bounded: at most kMaxDataDirectories directories,
// files of at most kMaxFileSize bytes, lines of at most kMaxLineLength
// bytes, kMaxDeclarationFiles declaration documents. What is over a bound,
// unreadable or malformed is left out and named in the table's problems();
// missing files are simply absent.

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "platform/types/TypeTable.h"
#include "platform/value/Value.h"

namespace types {

inline constexpr size_t kMaxDataDirectories = 16;
inline constexpr size_t kMaxFileSize = 1 << 20;
inline constexpr size_t kMaxLineLength = 512;
inline constexpr size_t kMaxDeclarationFiles = 256;

struct TypePaths {
  std::vector<std::string> mimeDirectories;  // $TENON_ROOT/D/mime, in precedence order
  std::string declarationsDirectory;         // $TENON_ROOT/usr/share/tenon/types

  // Paths for a root and a value of XDG_DATA_DIRS.
  static TypePaths forRoot(const std::string& root, const std::string& dataDirectories);
  // forRoot($TENON_ROOT, $XDG_DATA_DIRS), read when called.
  static TypePaths fromEnvironment();
};

// Reads every source and builds the table. Never fails: what cannot be
// read is a problem of the table.
std::shared_ptr<const TypeTable> loadTypeTable(const TypePaths& paths);

// The parts of loadTypeTable, for tests: one subclasses or aliases file's
// contents (name labels problems) and one declarations document.
void addSubclassLines(TypeTableBuilder& builder, std::string_view contents, const std::string& name);
void addAliasLines(TypeTableBuilder& builder, std::string_view contents, const std::string& name);
void addDeclarations(TypeTableBuilder& builder, const tn::Value& document, const std::string& name);

}  // namespace types
