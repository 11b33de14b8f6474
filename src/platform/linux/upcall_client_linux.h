// The other end of the upcall channel, as a sandbox launcher (or kestrelctl,
// or a benchmark) uses it: one request datagram out, one reply datagram back.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/root.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

// <root>/run/kestrel/<serviceName>
std::string upcallSocketPath(const FilesystemRoot& root, const std::string& serviceName);

class UpcallClient {
 public:
  enum class Status {
    Reply,     // the reply is in `reply`
    Closed,    // the service closed the connection without replying
    TimedOut,  // no reply within the time given
    Failed,    // sending or receiving failed (the reason in `message`)
  };
  struct Outcome {
    Status status = Status::Failed;
    std::vector<std::uint8_t> reply;
    std::string message;
  };

  // Nothing, with the reason (e.g. "Permission denied"), when the socket
  // cannot be connected to.
  static std::optional<UpcallClient> connect(const std::string& socketPath, std::string* error);

  // Sends one datagram and waits for one reply; a timeout of 0 waits for ever.
  Outcome call(std::span<const std::uint8_t> request,
               std::chrono::milliseconds timeout = std::chrono::milliseconds(0));
  // The two halves, for callers that send several requests before reading or
  // work while the service answers; a failed send gives call's message.
  bool send(std::span<const std::uint8_t> request, std::string* error);
  Outcome receive(std::chrono::milliseconds timeout = std::chrono::milliseconds(0));

 private:
  explicit UpcallClient(UniqueFd fd) : fd_(std::move(fd)) {}
  UniqueFd fd_;
  std::unique_ptr<std::uint8_t[]> buffer_;  // room for the largest reply, made by the first receive
};

}  // namespace kestrel::platform
