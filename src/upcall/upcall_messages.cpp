#include "upcall/upcall_messages.h"

#include <cstring>

namespace kestrel {

namespace {

constexpr std::uint8_t kRepresentationRecord[8] = {0, 0, 0, 0, 1, 0, 0, 0};

void putWord(std::vector<std::uint8_t>& bytes, std::size_t offset, std::uint32_t value) {
  std::memcpy(bytes.data() + offset, &value, sizeof value);
}

}  // namespace

std::uint32_t KSTUpcallWord(std::span<const std::uint8_t> bytes, std::size_t offset) {
  std::uint32_t value = 0;
  if (offset <= bytes.size() && bytes.size() - offset >= sizeof value) {
    std::memcpy(&value, bytes.data() + offset, sizeof value);
  }
  return value;
}

std::vector<std::uint8_t> KSTUpcallComplexMessage(std::uint32_t disposition,
                                                  std::uint32_t remotePort, std::uint32_t id,
                                                  std::span<const std::uint8_t> region,
                                                  bool deallocate) {
  using namespace upcall_field;
  std::vector<std::uint8_t> message(kKSTUpcallMessageSize + region.size(), 0);
  const auto size = static_cast<std::uint32_t>(region.size());
  putWord(message, kBits, kKSTUpcallComplexBit | (disposition & kKSTUpcallDispositionMask));
  putWord(message, kSize, kKSTUpcallMessageSize);
  putWord(message, kRemotePort, remotePort);
  putWord(message, kId, id);
  putWord(message, kDescriptorCount, 1);
  putWord(message, kAddress, kKSTUpcallMessageSize);
  message[kDeallocate] = deallocate ? 1 : 0;
  message[kCopy] = kKSTUpcallVirtualCopy;
  message[kDescriptorType] = kKSTUpcallOutOfLineDescriptor;
  putWord(message, kOutOfLineSize, size);
  std::memcpy(message.data() + kRecord, kRepresentationRecord, sizeof kRepresentationRecord);
  putWord(message, kRepeatedSize, size);
  if (!region.empty()) {
    std::memcpy(message.data() + kKSTUpcallMessageSize, region.data(), region.size());
  }
  return message;
}

std::vector<std::uint8_t> KSTUpcallErrorReply(std::span<const std::uint8_t> requestHeader,
                                              std::int32_t returnCode) {
  using namespace upcall_field;
  std::vector<std::uint8_t> reply(kKSTUpcallErrorReplySize, 0);
  putWord(reply, kBits, KSTUpcallWord(requestHeader, kBits) & kKSTUpcallDispositionMask);
  putWord(reply, kSize, kKSTUpcallErrorReplySize);
  putWord(reply, kRemotePort, KSTUpcallWord(requestHeader, kRemotePort));
  putWord(reply, kId, KSTUpcallWord(requestHeader, kId) + kKSTUpcallReplyIdDelta);
  std::memcpy(reply.data() + kErrorRecord, kRepresentationRecord, sizeof kRepresentationRecord);
  putWord(reply, kReturnCode, static_cast<std::uint32_t>(returnCode));
  return reply;
}

std::optional<KSTUpcallReply> KSTUpcallParseReply(std::span<const std::uint8_t> datagram,
                                                  std::string* error) {
  using namespace upcall_field;
  auto refuse = [&](const char* why) -> std::optional<KSTUpcallReply> {
    if (error != nullptr) *error = why;
    return std::nullopt;
  };
  KSTUpcallReply reply;
  reply.id = KSTUpcallWord(datagram, kId);
  const std::uint32_t size = KSTUpcallWord(datagram, kSize);
  if ((KSTUpcallWord(datagram, kBits) & kKSTUpcallComplexBit) == 0) {
    if (datagram.size() != kKSTUpcallErrorReplySize || size != kKSTUpcallErrorReplySize) {
      return refuse("a simple reply that is not 36 bytes long");
    }
    reply.returnCode = static_cast<std::int32_t>(KSTUpcallWord(datagram, kReturnCode));
    return reply;
  }
  if (datagram.size() < kKSTUpcallMessageSize || size != kKSTUpcallMessageSize ||
      KSTUpcallWord(datagram, kDescriptorCount) != 1 ||
      datagram[kDescriptorType] != kKSTUpcallOutOfLineDescriptor) {
    return refuse("a complex reply without one out-of-line region");
  }
  const std::uint32_t address = KSTUpcallWord(datagram, kAddress);
  const std::uint32_t length = KSTUpcallWord(datagram, kOutOfLineSize);
  if (length != KSTUpcallWord(datagram, kRepeatedSize) || address < kKSTUpcallMessageSize ||
      std::uint64_t{address} + length > datagram.size()) {
    return refuse("a reply whose out-of-line region lies outside it");
  }
  reply.region = datagram.subspan(address, length);
  return reply;
}

}  // namespace kestrel
