#pragma once

// The CBOR codec of the wire: how a tn::Value travels in a relay frame body
// (RFC 8949), written for this system rather than taken from a library so
// that every rejection rule is ours, every error names the byte where the
// input went wrong, and decoding builds tn::Value directly without an
// intermediate tree. docs/wire-values.md describes the format for client
// authors; this header states the C++ contract.
//
// Mapping: dictionary → map with text keys, in the dictionary's order;
// array → array; string → text string; uint64 → major type 0; int64 → major
// type 1 when negative, major type 0 otherwise; double → float64; bool →
// true/false; null → null; data → byte string; date → tag 1 on a float64;
// UUID → tag 37 on a 16-byte byte string. Integer heads use the shortest
// form. A non-negative int64 therefore reads back as a uint64; the typed
// encoding (TypedEncoding.h) is the lossless variant.
//
// The decoder treats its input as hostile: it reads only what the input
// holds, checks every length against the remaining input before allocating,
// caps nesting at kMaxCborDepth, and refuses everything the mapping above
// does not produce (see CborErrorCode).

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tn {

// The error domain of every decoding failure. Messages read
// "CBOR error at byte 17: duplicate map key \"version\"".
inline constexpr std::string_view kCborErrorDomain = "CBOR";

// Error codes (tn::Error::code() of domain kCborErrorDomain). Stable: client
// libraries and tests compare them.
enum class CborErrorCode : int64_t {
  Truncated = 1,            // input ends inside an item, or a length exceeds what remains
  TrailingBytes = 2,        // bytes after the one item
  Malformed = 3,            // reserved additional information 28-30, or 31 where CBOR has no
                            // indefinite form
  IndefiniteLength = 4,     // indefinite-length string, array or map, or a break code
  TooDeep = 5,              // arrays and maps nested more than kMaxCborDepth deep
  InvalidMapKey = 6,        // a map key that is not a text string
  DuplicateMapKey = 7,      // the same text key twice in one map
  UnknownTag = 8,           // any tag but 1 and 37 (and the typed-integer tag in typed mode)
  InvalidTagContent = 9,    // a known tag around the wrong kind of item
  UnsupportedSimpleValue = 10,  // simple values other than false, true and null
  IntegerOutOfRange = 11,   // a negative integer below INT64_MIN
  InvalidUTF8 = 12,         // a text string (or key) that is not valid UTF-8
  NotAMap = 13,             // a message body that is not a map
  NotTypedData = 14,        // decodeTyped() of a value that is not data
};

// True when error is a CBOR decoding error with that code.
bool isCborError(const Error& error, CborErrorCode code);

// Arrays and maps may nest this deep: a top-level array is at depth 1, and an
// array or map at depth 65 is refused. Tags do not add depth (the accepted
// tags only enclose scalars).
inline constexpr int kMaxCborDepth = 64;

// Tag numbers.
inline constexpr uint64_t kCborDateTag = 1;   // epoch-based date/time
inline constexpr uint64_t kCborUUIDTag = 37;  // binary UUID
// Private tag of the typed encoding: a non-negative signed 64-bit integer
// (ASCII "TNYK"). Accepted only in CborDialect::Typed.
inline constexpr uint64_t kCborTypedIntegerTag = 1414420811;

enum class CborDialect {
  Wire,   // the mapping above
  Typed,  // plus kCborTypedIntegerTag around every non-negative int64 (lossless)
};

// Appends the CBOR encoding of value to out (the relay writes several frames
// into one buffer). Strings are expected to be UTF-8, as tn::Value requires;
// a string that is not has each invalid byte replaced by U+FFFD, so the
// encoder never writes what a decoder must refuse (a dictionary whose keys
// become equal that way keeps the first). Arrays and dictionaries deeper
// than kMaxCborDepth are written, but no decoder of this system reads them.
void appendCbor(Bytes& out, const Value& value, CborDialect dialect = CborDialect::Wire);

// The CBOR encoding of value, as appendCbor writes it.
Bytes encodeCbor(const Value& value, CborDialect dialect = CborDialect::Wire);

// A map (or an array) encoded piece by piece, for callers that keep the encoding of some
// entries and add others per use: the head of a map of `count` entries,
// then each entry as appendCborEntry writes it. The result is byte for byte
// appendCbor's encoding of the dictionary holding those entries in that
// order (keys are expected to be distinct and UTF-8).
void appendCborMapHead(Bytes& out, uint64_t count);
// The same for an array: its head, then each element's appendCbor.
void appendCborArrayHead(Bytes& out, uint64_t count);
void appendCborEntry(Bytes& out, std::string_view key, const Value& value, CborDialect dialect = CborDialect::Wire);

// Decodes exactly one CBOR item of any kind, which must fill the input.
// Returns a CBOR-domain error naming the byte offset of the first problem.
Result<Value> decodeCbor(std::span<const uint8_t> bytes, CborDialect dialect = CborDialect::Wire);

// Decodes a relay message body: like decodeCbor in the wire dialect, but the
// item must be a map (checked before anything else is decoded).
Result<Value> decodeMessageBody(std::span<const uint8_t> bytes);

}  // namespace tn
