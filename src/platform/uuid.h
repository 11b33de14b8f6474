// A 128-bit UUID: random generation, and the canonical text form, which this
// system always writes in upper case ("6F1B2C3D-...").
#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace kestrel::platform {

class Uuid {
 public:
  using Bytes = std::array<std::uint8_t, 16>;

  // The nil UUID (all zero).
  Uuid() = default;
  explicit Uuid(const Bytes& bytes) : bytes_(bytes) {}

  // A new random (version 4) UUID.
  static Uuid random();
  // The canonical 36-character form, in either case; nothing for anything else.
  static std::optional<Uuid> parse(std::string_view text);
  // Exactly 16 bytes; nothing for any other length.
  static std::optional<Uuid> fromBytes(std::span<const std::uint8_t> bytes);

  const Bytes& bytes() const { return bytes_; }
  bool isNil() const;
  // Upper-case canonical text.
  std::string string() const;
  std::string description() const { return string(); }

  friend auto operator<=>(const Uuid&, const Uuid&) = default;
  friend bool operator==(const Uuid&, const Uuid&) = default;

 private:
  Bytes bytes_{};
};

}  // namespace kestrel::platform
