// The kernel upcall channel: a named service whose requests arrive as single
// datagrams and are answered with single datagrams on the same connection.
//
// A datagram is a message's fixed part (its size in the header word at offset
// 4) followed by the out-of-line regions its descriptors name by offset. The
// channel hands the server the fixed part followed by a receive trailer that
// it builds itself, as a kernel would, from what the kernel vouches for about
// the sender; the sender cannot forge it.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/dispatch.h"

namespace kestrel::platform {

// The sender of one request, as the kernel vouches for it.
struct UpcallPeer {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
};

// The receive trailer: format (0, the default), its size, a sequence number,
// the sender's security token (uid, gid) and at offset 20 its audit token of
// eight words (audit user, euid, egid, ruid, rgid, pid, session, pid version).
// A sender running as root stands for the kernel: its audit token carries pid 0.
inline constexpr std::size_t kUpcallTrailerSize = 52;
inline constexpr std::uint32_t kUpcallTrailerFormatDefault = 0;
inline constexpr std::size_t kUpcallTrailerAuditTokenOffset = 20;
inline constexpr std::size_t kUpcallAuditTokenSize = 32;
inline constexpr std::size_t kUpcallHeaderSize = 24;
inline constexpr std::size_t kUpcallSizeOffset = 4;

std::array<std::uint8_t, kUpcallTrailerSize> makeUpcallTrailer(const UpcallPeer& peer,
                                                               std::uint32_t sequence);
// The process id inside an audit token (kUpcallAuditTokenSize bytes).
pid_t upcallAuditTokenPid(std::span<const std::uint8_t> auditToken);

// One received message.
class UpcallMessage {
 public:
  // Nothing, with the reason, for a datagram that carries no message the
  // server may be given: shorter than a header, its size word below a header
  // or beyond the datagram, or above maxMessageSize.
  static std::optional<UpcallMessage> fromDatagram(std::vector<std::uint8_t> datagram,
                                                   const UpcallPeer& peer,
                                                   std::size_t maxMessageSize,
                                                   std::uint32_t sequence, std::string* problem);

  // The fixed part as sent, followed by the trailer.
  std::span<const std::uint8_t> message() const { return message_; }
  // The out-of-line region at the offset and of the size a descriptor names;
  // nothing unless it lies wholly after the fixed part, inside the datagram.
  // It goes with the message.
  std::optional<std::span<const std::uint8_t>> outOfLine(std::uint32_t address,
                                                         std::uint32_t size) const;

 private:
  UpcallMessage() = default;
  std::vector<std::uint8_t> datagram_;
  std::vector<std::uint8_t> message_;
};

// A checked-in service: owns its listening endpoint.
class UpcallPort {
 public:
  virtual ~UpcallPort() = default;
  virtual const std::string& serviceName() const = 0;
};

// Handles one message; returns the reply datagram (its out-of-line region
// right after the fixed part, named by offset), or nothing when the message
// is not the server's: the channel then drops the connection it came on.
using UpcallHandler = std::function<std::optional<std::vector<std::uint8_t>>(const UpcallMessage&)>;
// Told what the channel did about a connection on its own (a datagram that is
// no message, a reply it could not deliver), for the log.
using UpcallProblemHandler = std::function<void(const std::string& what)>;

class UpcallChannel {
 public:
  virtual ~UpcallChannel() = default;
  // nullptr with an error text when the service cannot be checked in.
  virtual std::shared_ptr<UpcallPort> checkIn(const std::string& serviceName,
                                              std::string* errorText) = 0;
  // Receives the port's messages of at most maxMessageSize bytes (the fixed
  // part) on the queue. Starts suspended; nullptr when the source cannot be made.
  virtual std::unique_ptr<ReadSource> createReceiveSource(std::shared_ptr<UpcallPort> port,
                                                          std::shared_ptr<DispatchQueue> queue,
                                                          std::size_t maxMessageSize,
                                                          UpcallHandler handler,
                                                          UpcallProblemHandler problems) = 0;
};

}  // namespace kestrel::platform
