#include "platform/uuid.h"

#include <uuid/uuid.h>

#include <algorithm>

#include "platform/hex.h"

namespace kestrel::platform {

Uuid Uuid::random() {
  Bytes bytes;
  ::uuid_generate_random(bytes.data());
  return Uuid(bytes);
}

// The canonical form only: 8-4-4-4-12 hexadecimal digits of either case. Read
// here rather than by the library, which wants a terminated copy and costs a
// visible share of a cache rebuild (one UUID per container).
std::optional<Uuid> Uuid::parse(std::string_view text) {
  constexpr std::size_t kLength = 36;
  constexpr std::size_t kGroupBytes[] = {4, 2, 2, 2, 6};
  if (text.size() != kLength) return std::nullopt;
  Bytes bytes;
  std::span<std::uint8_t> out(bytes);
  for (const std::size_t groupBytes : kGroupBytes) {
    if (!decodeHex(text.substr(0, groupBytes * 2), out.first(groupBytes))) return std::nullopt;
    text.remove_prefix(groupBytes * 2);
    out = out.subspan(groupBytes);
    if (!out.empty()) {
      if (text.front() != '-') return std::nullopt;
      text.remove_prefix(1);
    }
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
