#include "platform/uuid.h"

#include <uuid/uuid.h>

#include <algorithm>

namespace kestrel::platform {

Uuid Uuid::random() {
  Bytes bytes;
  ::uuid_generate_random(bytes.data());
  return Uuid(bytes);
}

namespace {

// The value of a hexadecimal digit of either case, or -1.
int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

// The canonical form only: 8-4-4-4-12 hexadecimal digits of either case. Read
// here rather than by the library, which wants a terminated copy and costs a
// visible share of a cache rebuild (one UUID per container).
std::optional<Uuid> Uuid::parse(std::string_view text) {
  constexpr std::size_t kLength = 36;
  if (text.size() != kLength) return std::nullopt;
  Bytes bytes;
  std::size_t out = 0;
  for (std::size_t i = 0; i < kLength;) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    const int high = hexValue(text[i]);
    const int low = hexValue(text[i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    bytes[out++] = static_cast<std::uint8_t>((high << 4) | low);
    i += 2;
  }
  return Uuid(bytes);
}

std::optional<Uuid> Uuid::fromBytes(std::span<const std::uint8_t> bytes) {
  if (bytes.size() != std::tuple_size_v<Bytes>) return std::nullopt;
  Bytes copy;
  std::copy(bytes.begin(), bytes.end(), copy.begin());
  return Uuid(copy);
}

bool Uuid::isNil() const {
  return std::all_of(bytes_.begin(), bytes_.end(), [](std::uint8_t b) { return b == 0; });
}

std::string Uuid::string() const {
  char buffer[37];
  ::uuid_unparse_upper(bytes_.data(), buffer);
  return std::string(buffer);
}

}  // namespace kestrel::platform
