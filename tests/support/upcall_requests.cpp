#include "support/upcall_requests.h"

#include <cstring>

#include "upcall/upcall_messages.h"

namespace kestrel::testing {

UpcallItem UpcallItem::string(std::uint16_t valueType, const std::string& text) {
  std::vector<std::uint8_t> payload(text.begin(), text.end());
  payload.push_back(0);
  const auto length = static_cast<std::uint32_t>(payload.size());
  return raw(2, valueType, std::move(payload), length);
}

UpcallItem UpcallItem::number(std::uint16_t valueType, std::uint32_t value) {
  return {1, valueType, value, {}};
}

UpcallItem UpcallItem::raw(std::uint16_t itemType, std::uint16_t valueType,
                           std::vector<std::uint8_t> payload, std::uint32_t claimedLength) {
  return {itemType, valueType, claimedLength, std::move(payload)};
}

std::vector<std::uint8_t> packedItems(const std::vector<UpcallItem>& items) {
  std::vector<std::uint8_t> bytes;
  for (const UpcallItem& item : items) {
    std::uint8_t header[8];
    std::memcpy(header, &item.itemType, 2);
    std::memcpy(header + 2, &item.valueType, 2);
    std::memcpy(header + 4, &item.word, 4);
    bytes.insert(bytes.end(), header, header + 8);
    bytes.insert(bytes.end(), item.payload.begin(), item.payload.end());
    bytes.resize((bytes.size() + 7) / 8 * 8, 0);
  }
  bytes.resize(bytes.size() + 8, 0);
  return bytes;
}

std::vector<std::uint8_t> upcallRequest(const std::vector<UpcallItem>& items) {
  return KSTUpcallComplexMessage(kKSTUpcallSendOnceDisposition, 77, kKSTUpcallProcessContainersId,
                                 packedItems(items), false);
}

}  // namespace kestrel::testing
