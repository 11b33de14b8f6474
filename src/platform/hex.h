// Hexadecimal text to bytes.
#pragma once

#include <cstdint>
#include <span>
#include <string_view>

namespace kestrel::platform {

// Decodes two digits (of either case) a byte into `out`, which must be half as
// long as `text`; false when `text` holds anything but hexadecimal digits.
inline bool decodeHex(std::string_view text, std::span<std::uint8_t> out) {
  const auto digit = [](char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  };
  if (text.size() != out.size() * 2) return false;
  for (std::size_t i = 0; i < out.size(); ++i) {
    const int high = digit(text[2 * i]);
    const int low = digit(text[2 * i + 1]);
    if (high < 0 || low < 0) return false;
    out[i] = static_cast<std::uint8_t>((high << 4) | low);
  }
  return true;
}

}  // namespace kestrel::platform
