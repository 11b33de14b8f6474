// An upcall channel for tests: check-in and source creation can be made to
// fail, and requests are delivered by hand.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/upcall_channel.h"

namespace kestrel::platform {

class FakeUpcallChannel final : public UpcallChannel {
 public:
  std::shared_ptr<UpcallPort> checkIn(const std::string& serviceName,
                                      std::string* errorText) override;
  std::unique_ptr<ReadSource> createReceiveSource(std::shared_ptr<UpcallPort> port,
                                                  std::shared_ptr<DispatchQueue> queue,
                                                  std::size_t maxMessageSize, UpcallHandler handler,
                                                  UpcallProblemHandler problems) override;

  void setCheckInFails(bool fails);
  void setSourceFails(bool fails);
  std::vector<std::string> checkedIn() const;
  bool sourceResumed() const;
  // Calls the receive source's handler, as a request datagram from the peer
  // would; nothing when the datagram carries no message or is not answered.
  std::optional<std::vector<std::uint8_t>> deliver(std::vector<std::uint8_t> datagram,
                                                   const UpcallPeer& peer);

 private:
  friend class FakeUpcallSource;
  mutable std::mutex mutex_;
  bool checkInFails_ = false;
  bool sourceFails_ = false;
  bool sourceResumed_ = false;
  std::vector<std::string> checkedIn_;
  std::size_t maxMessageSize_ = 0;
  std::uint32_t sequence_ = 0;
  UpcallHandler handler_;
};

}  // namespace kestrel::platform
