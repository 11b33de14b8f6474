// Upcall requests written by hand, item by item, so that tests can also make
// the items the packed-buffer writer refuses to make.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace kestrel::testing {

struct UpcallItem {
  std::uint16_t itemType = 0;
  std::uint16_t valueType = 0;
  std::uint32_t word = 0;  // the value, or the payload length the header claims
  std::vector<std::uint8_t> payload;

  static UpcallItem string(std::uint16_t valueType, const std::string& text);
  static UpcallItem number(std::uint16_t valueType, std::uint32_t value);
  // Any item type, with a payload and the length its header claims.
  static UpcallItem raw(std::uint16_t itemType, std::uint16_t valueType,
                        std::vector<std::uint8_t> payload, std::uint32_t claimedLength);
};

// The items, each padded to 8 bytes, then the end item.
std::vector<std::uint8_t> packedItems(const std::vector<UpcallItem>& items);
// A request datagram carrying the items (reply port 77, send-once).
std::vector<std::uint8_t> upcallRequest(const std::vector<UpcallItem>& items);

}  // namespace kestrel::testing
