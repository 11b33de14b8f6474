// The messages of the upcall service: one routine, "get process containers",
// with one out-of-line byte array (a packed buffer) in each direction. Words
// are 32-bit, little-endian.
//
// Request, 52 bytes (the channel appends its trailer when it receives one):
//    0  header bits: 0x80000000 (complex) plus the reply port's disposition
//       in the low 5 bits
//    4  message size: 52
//    8  reply port; 12 local port; 16 reserved
//   20  message id: 322514900
//   24  descriptor count: 1
//   28  out-of-line address: on this channel, the region's offset in the
//       datagram (52: the region follows the fixed part)
//   32  deallocate, copy option, unused (one byte each), descriptor type
//       (1: out-of-line memory)
//   36  out-of-line size
//   40  data-representation record: 00 00 00 00 01 00 00 00
//   48  the size again
//
// Reply: the request's header with id + 100, sent back to the reply port. An
// error reply is 36 bytes, not complex: the record at 24 and the signed return
// code at 32. A success reply is laid out as the request, followed by its
// region.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace kestrel {

inline constexpr const char* kKSTUpcallServerTag = "demux_server";
inline constexpr std::uint32_t kKSTUpcallProcessContainersId = 322514900;
// The id after the routine's: this server's, but no routine of it.
inline constexpr std::uint32_t kKSTUpcallUnservedId = 322514901;
inline constexpr std::uint32_t kKSTUpcallReplyIdDelta = 100;
inline constexpr std::size_t kKSTUpcallMessageSize = 52;
inline constexpr std::size_t kKSTUpcallErrorReplySize = 36;
inline constexpr std::uint32_t kKSTUpcallComplexBit = 0x80000000u;
inline constexpr std::uint32_t kKSTUpcallDispositionMask = 0x1fu;
// How a launcher's reply port travels: a send-once right.
inline constexpr std::uint32_t kKSTUpcallSendOnceDisposition = 18;
inline constexpr std::uint8_t kKSTUpcallOutOfLineDescriptor = 1;
inline constexpr std::uint8_t kKSTUpcallVirtualCopy = 1;

// The interface generator's codes for a malformed message.
inline constexpr std::int32_t kKSTUpcallTypeError = -300;
inline constexpr std::int32_t kKSTUpcallBadId = -303;
inline constexpr std::int32_t kKSTUpcallBadArguments = -304;
inline constexpr std::int32_t kKSTUpcallTrailerError = -309;

namespace upcall_field {
inline constexpr std::size_t kBits = 0;
inline constexpr std::size_t kSize = 4;
inline constexpr std::size_t kRemotePort = 8;
inline constexpr std::size_t kLocalPort = 12;
inline constexpr std::size_t kId = 20;
inline constexpr std::size_t kDescriptorCount = 24;
inline constexpr std::size_t kAddress = 28;
inline constexpr std::size_t kDeallocate = 32;
inline constexpr std::size_t kCopy = 33;
inline constexpr std::size_t kDescriptorType = 35;
inline constexpr std::size_t kOutOfLineSize = 36;
inline constexpr std::size_t kRecord = 40;
inline constexpr std::size_t kRepeatedSize = 48;
inline constexpr std::size_t kErrorRecord = 24;
inline constexpr std::size_t kReturnCode = 32;
}  // namespace upcall_field

// The word at offset; 0 where the bytes end before it.
std::uint32_t KSTUpcallWord(std::span<const std::uint8_t> bytes, std::size_t offset);

// A complex message with one out-of-line region: the fixed part, then the region.
std::vector<std::uint8_t> KSTUpcallComplexMessage(std::uint32_t disposition,
                                                  std::uint32_t remotePort, std::uint32_t id,
                                                  std::span<const std::uint8_t> region,
                                                  bool deallocate);
// The 36-byte error reply to the request whose header is given.
std::vector<std::uint8_t> KSTUpcallErrorReply(std::span<const std::uint8_t> requestHeader,
                                              std::int32_t returnCode);

// A reply as its receiver reads it: a return code, and with code 0 the region.
struct KSTUpcallReply {
  std::uint32_t id = 0;
  std::int32_t returnCode = 0;
  std::span<const std::uint8_t> region;  // inside the datagram
};
// Nothing, with the reason, for a datagram that is neither reply form.
std::optional<KSTUpcallReply> KSTUpcallParseReply(std::span<const std::uint8_t> datagram,
                                                  std::string* error);

}  // namespace kestrel
