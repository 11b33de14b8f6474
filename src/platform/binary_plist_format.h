// The pieces of the binary property-list format ("bplist00") that its reader
// and writer share.
#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <string_view>
#include <vector>

namespace kestrel::platform::bplist {

inline constexpr std::string_view kMagic = "bplist00";
inline constexpr std::size_t kTrailerSize = 32;
inline constexpr std::uint64_t kInt64Max =
    static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());

// Object markers: the high nibble is the kind, the low one a size or a count.
inline constexpr std::uint8_t kMarkerFalse = 0x08;
inline constexpr std::uint8_t kMarkerTrue = 0x09;
inline constexpr std::uint8_t kMarkerInteger = 0x10;
inline constexpr std::uint8_t kMarkerInteger16Bytes = 0x14;
inline constexpr std::uint8_t kMarkerDate = 0x33;
inline constexpr std::uint8_t kKindSimple = 0x0;
inline constexpr std::uint8_t kKindInteger = 0x1;
inline constexpr std::uint8_t kKindReal = 0x2;
inline constexpr std::uint8_t kKindDate = 0x3;
inline constexpr std::uint8_t kKindData = 0x4;
inline constexpr std::uint8_t kKindAsciiString = 0x5;
inline constexpr std::uint8_t kKindUnicodeString = 0x6;
inline constexpr std::uint8_t kKindUid = 0x8;
inline constexpr std::uint8_t kKindArray = 0xA;
inline constexpr std::uint8_t kKindOrderedSet = 0xB;
inline constexpr std::uint8_t kKindSet = 0xC;
inline constexpr std::uint8_t kKindDictionary = 0xD;
// In the low nibble: the count is an integer object that follows the marker.
inline constexpr std::uint8_t kCountFollows = 0xF;

inline void appendBigEndian(std::vector<std::uint8_t>& out, std::uint64_t value, std::size_t size) {
  for (std::size_t i = size; i-- > 0;) out.push_back(static_cast<std::uint8_t>(value >> (8 * i)));
}

inline std::uint64_t readBigEndian(const std::uint8_t* p, std::size_t size) {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < size; ++i) value = (value << 8) | p[i];
  return value;
}

}  // namespace kestrel::platform::bplist
