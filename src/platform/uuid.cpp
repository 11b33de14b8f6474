#include "platform/uuid.h"

#include <uuid/uuid.h>

#include <algorithm>

namespace kestrel::platform {

Uuid Uuid::random() {
  Bytes bytes;
  ::uuid_generate_random(bytes.data());
  return Uuid(bytes);
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
  // uuid_parse wants a terminated string of exactly the canonical length.
  constexpr std::size_t kLength = 36;
  if (text.size() != kLength) return std::nullopt;
  char buffer[kLength + 1];
  std::copy(text.begin(), text.end(), buffer);
  buffer[kLength] = '\0';
  Bytes bytes;
  if (::uuid_parse(buffer, bytes.data()) != 0) return std::nullopt;
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
