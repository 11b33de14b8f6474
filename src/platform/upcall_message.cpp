// What the upcall channel does as a kernel would, the same on every transport:
// the receive trailer and the split of a datagram into message and regions.
#include <cstring>

#include "platform/upcall_channel.h"

namespace kestrel::platform {

namespace {

void putWord(std::uint8_t* at, std::uint32_t value) {
  std::memcpy(at, &value, sizeof value);
}

std::uint32_t wordAt(const std::uint8_t* at) {
  std::uint32_t value = 0;
  std::memcpy(&value, at, sizeof value);
  return value;
}

constexpr std::size_t kAuditPidWord = 5;

}  // namespace

std::array<std::uint8_t, kUpcallTrailerSize> makeUpcallTrailer(const UpcallPeer& peer,
                                                               std::uint32_t sequence) {
  std::array<std::uint8_t, kUpcallTrailerSize> trailer{};
  putWord(&trailer[0], kUpcallTrailerFormatDefault);
  putWord(&trailer[4], static_cast<std::uint32_t>(kUpcallTrailerSize));
  putWord(&trailer[8], sequence);
  putWord(&trailer[12], peer.uid);  // security token
  putWord(&trailer[16], peer.gid);
  const std::uint32_t audit[8] = {
      peer.uid, peer.uid, peer.gid,
      peer.uid, peer.gid, peer.uid == 0 ? 0u : static_cast<std::uint32_t>(peer.pid),
      0,        0};
  std::memcpy(&trailer[kUpcallTrailerAuditTokenOffset], audit, sizeof audit);
  return trailer;
}

pid_t upcallAuditTokenPid(std::span<const std::uint8_t> auditToken) {
  if (auditToken.size() < kUpcallAuditTokenSize) return -1;
  return static_cast<pid_t>(wordAt(auditToken.data() + 4 * kAuditPidWord));
}

std::optional<UpcallMessage> UpcallMessage::fromDatagram(std::vector<std::uint8_t> datagram,
                                                         const UpcallPeer& peer,
                                                         std::size_t maxMessageSize,
                                                         std::uint32_t sequence,
                                                         std::string* problem) {
  auto refuse = [&](std::string why) -> std::optional<UpcallMessage> {
    if (problem != nullptr) *problem = std::move(why);
    return std::nullopt;
  };
  if (datagram.size() < kUpcallHeaderSize) {
    return refuse("a datagram of " + std::to_string(datagram.size()) +
                  " bytes is shorter than a message header");
  }
  const std::uint32_t size = wordAt(datagram.data() + kUpcallSizeOffset);
  if (size < kUpcallHeaderSize || size > datagram.size()) {
    return refuse("message size " + std::to_string(size) + " does not fit its datagram of " +
                  std::to_string(datagram.size()) + " bytes");
  }
  if (size > maxMessageSize) {
    return refuse("a message of " + std::to_string(size) + " bytes is larger than the " +
                  std::to_string(maxMessageSize) + " served");
  }
  UpcallMessage message;
  message.message_.reserve(size + kUpcallTrailerSize);
  message.message_.assign(datagram.begin(), datagram.begin() + size);
  const auto trailer = makeUpcallTrailer(peer, sequence);
  message.message_.insert(message.message_.end(), trailer.begin(), trailer.end());
  message.datagram_ = std::move(datagram);
  return message;
}

std::optional<std::span<const std::uint8_t>> UpcallMessage::outOfLine(std::uint32_t address,
                                                                      std::uint32_t size) const {
  const std::size_t fixedSize = message_.size() - kUpcallTrailerSize;
  if (address < fixedSize || std::uint64_t{address} + size > datagram_.size()) return std::nullopt;
  return std::span<const std::uint8_t>(datagram_).subspan(address, size);
}

}  // namespace kestrel::platform
