#include "platform/value/Base64.h"

#include <array>
#include <cstdint>

namespace tn {
namespace {

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

constexpr uint8_t kNotBase64 = 0xFF;
constexpr uint8_t kSkipped = 0xFE;  // whitespace
constexpr uint8_t kPad = 0xFD;

constexpr std::array<uint8_t, 256> makeDecodeTable() {
  std::array<uint8_t, 256> table{};
  for (auto& entry : table) entry = kNotBase64;
  for (uint8_t i = 0; i < 64; ++i) table[static_cast<uint8_t>(kAlphabet[i])] = i;
  for (char c : {' ', '\t', '\n', '\r', '\f', '\v'}) table[static_cast<uint8_t>(c)] = kSkipped;
  table['='] = kPad;
  return table;
}

constexpr std::array<uint8_t, 256> kDecodeTable = makeDecodeTable();

std::string encode(const uint8_t* bytes, size_t size) {
  std::string out;
  out.reserve((size + 2) / 3 * 4);
  size_t i = 0;
  for (; i + 3 <= size; i += 3) {
    const uint32_t n = uint32_t{bytes[i]} << 16 | uint32_t{bytes[i + 1]} << 8 | bytes[i + 2];
    out.push_back(kAlphabet[n >> 18]);
    out.push_back(kAlphabet[(n >> 12) & 63]);
    out.push_back(kAlphabet[(n >> 6) & 63]);
    out.push_back(kAlphabet[n & 63]);
  }
  if (const size_t rest = size - i; rest > 0) {
    const uint32_t n = uint32_t{bytes[i]} << 16 | (rest == 2 ? uint32_t{bytes[i + 1]} << 8 : 0);
    out.push_back(kAlphabet[n >> 18]);
    out.push_back(kAlphabet[(n >> 12) & 63]);
    out.push_back(rest == 2 ? kAlphabet[(n >> 6) & 63] : '=');
    out.push_back('=');
  }
  return out;
}

// Decodes into any container of bytes or chars.
template <typename Output>
bool decodeInto(std::string_view text, Output& out) {
  out.reserve(text.size() / 4 * 3);
  uint32_t group = 0;  // the sextets of the current quad
  int sextets = 0;     // how many of them are filled
  int padding = 0;     // '=' seen; only more '=' and whitespace may follow
  for (char c : text) {
    const uint8_t v = kDecodeTable[static_cast<uint8_t>(c)];
    if (v == kSkipped) continue;
    if (v == kNotBase64) return false;
    if (v == kPad) {
      // Padding completes a quad holding two or three sextets.
      if (sextets + padding < 2) return false;
      ++padding;
      if (sextets + padding > 4) return false;
      continue;
    }
    if (padding > 0) return false;
    group = group << 6 | v;
    if (++sextets == 4) {
      out.push_back(static_cast<typename Output::value_type>(group >> 16));
      out.push_back(static_cast<typename Output::value_type>(group >> 8 & 0xFF));
      out.push_back(static_cast<typename Output::value_type>(group & 0xFF));
      group = 0;
      sextets = 0;
    }
  }
  if (padding == 0) return sextets == 0;
  if (sextets + padding != 4) return false;
  if (sextets == 2) {
    if (group & 0xF) return false;  // bits beyond the one byte
    out.push_back(static_cast<typename Output::value_type>(group >> 4));
  } else {
    if (group & 0x3) return false;
    out.push_back(static_cast<typename Output::value_type>(group >> 10));
    out.push_back(static_cast<typename Output::value_type>(group >> 2 & 0xFF));
  }
  return true;
}

}  // namespace

std::string encodeBase64(std::string_view bytes) {
  return encode(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
}

std::string encodeBase64(const Bytes& bytes) { return encode(bytes.data(), bytes.size()); }

std::optional<Bytes> decodeBase64(std::string_view text) {
  Bytes out;
  if (!decodeInto(text, out)) return std::nullopt;
  return out;
}

std::optional<std::string> decodeBase64ToString(std::string_view text) {
  std::string out;
  if (!decodeInto(text, out)) return std::nullopt;
  return out;
}

}  // namespace tn
