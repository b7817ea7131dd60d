#pragma once

// tn::UUID: the 16-byte identity the registry gives each installed plug-in,
// also used for hold tokens and knowledge versions. Text form is the canonical
// upper-case 8-4-4-4-12 hexadecimal string.

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include <fmt/format.h>

namespace tn {

class UUID {
 public:
  using Bytes = std::array<uint8_t, 16>;

  // The nil UUID (all zero bytes).
  constexpr UUID() : bytes_{} {}
  explicit constexpr UUID(const Bytes& bytes) : bytes_(bytes) {}

  // A new random (version 4) UUID from the kernel's random source.
  static UUID random();

  // Parses "E621E1F8-C36C-495A-93FC-0C247A3E6E5F" in either case. Only the
  // canonical 36-character form is accepted.
  static std::optional<UUID> parse(std::string_view text);

  const Bytes& bytes() const { return bytes_; }
  bool isNil() const;

  // Canonical upper-case text.
  std::string string() const;

  friend auto operator<=>(const UUID&, const UUID&) = default;

 private:
  Bytes bytes_;
};

}  // namespace tn

template <>
struct std::hash<tn::UUID> {
  size_t operator()(const tn::UUID& u) const noexcept;
};

template <>
struct fmt::formatter<tn::UUID> : fmt::formatter<std::string_view> {
  auto format(const tn::UUID& u, fmt::format_context& ctx) const {
    return fmt::formatter<std::string_view>::format(u.string(), ctx);
  }
};
