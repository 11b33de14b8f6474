// The kernel upcall channel: a named service whose requests arrive as single
// datagrams and are answered with single datagrams on the same connection.
#pragma once

#include <sys/types.h>

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

// A checked-in service: owns its listening endpoint.
class UpcallPort {
 public:
  virtual ~UpcallPort() = default;
  virtual const std::string& serviceName() const = 0;
};

// Handles one request; returns the reply datagram, or nothing to send no reply.
using UpcallHandler = std::function<std::optional<std::vector<std::uint8_t>>(
    std::span<const std::uint8_t> request, const UpcallPeer& peer)>;

class UpcallChannel {
 public:
  virtual ~UpcallChannel() = default;
  // nullptr with an error text when the service cannot be checked in.
  virtual std::shared_ptr<UpcallPort> checkIn(const std::string& serviceName,
                                              std::string* errorText) = 0;
  // Receives the port's requests on the queue. Starts suspended; nullptr when
  // the source cannot be made.
  virtual std::unique_ptr<ReadSource> createReceiveSource(std::shared_ptr<UpcallPort> port,
                                                          std::shared_ptr<DispatchQueue> queue,
                                                          UpcallHandler handler) = 0;
};

}  // namespace kestrel::platform
