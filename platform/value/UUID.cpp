#include "platform/value/UUID.h"

#include <sys/random.h>

#include <cstring>
#include <cerrno>
#include <cstdlib>

namespace tn {
namespace {

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

bool isDashPosition(size_t i) { return i == 8 || i == 13 || i == 18 || i == 23; }

void fillRandom(uint8_t* out, size_t size) {
  size_t done = 0;
  while (done < size) {
    ssize_t n = getrandom(out + done, size - done, 0);
    if (n > 0) {
      done += static_cast<size_t>(n);
    } else if (errno != EINTR) {
      // getrandom only fails before the pool is initialised or with a bad
      // buffer; neither can happen in a running daemon.
      std::abort();
    }
  }
}

}  // namespace

UUID UUID::random() {
  Bytes b;
  fillRandom(b.data(), b.size());
  b[6] = static_cast<uint8_t>((b[6] & 0x0F) | 0x40);  // version 4
  b[8] = static_cast<uint8_t>((b[8] & 0x3F) | 0x80);  // variant 1
  return UUID(b);
}

std::optional<UUID> UUID::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  Bytes b{};
  size_t byte = 0;
  for (size_t i = 0; i < 36;) {
    if (isDashPosition(i)) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    int hi = hexValue(text[i]);
    int lo = hexValue(text[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    b[byte++] = static_cast<uint8_t>(hi << 4 | lo);
    i += 2;
  }
  return UUID(b);
}

bool UUID::isNil() const {
  for (uint8_t v : bytes_)
    if (v != 0) return false;
  return true;
}

std::string UUID::string() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < 16; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out.push_back('-');
    out.push_back(kHex[bytes_[i] >> 4]);
    out.push_back(kHex[bytes_[i] & 0x0F]);
  }
  return out;
}

}  // namespace tn

size_t std::hash<tn::UUID>::operator()(const tn::UUID& u) const noexcept {
  uint64_t a, b;
  std::memcpy(&a, u.bytes().data(), 8);
  std::memcpy(&b, u.bytes().data() + 8, 8);
  return std::hash<uint64_t>{}(a ^ (b * 0x9E3779B97F4A7C15ULL));
}
