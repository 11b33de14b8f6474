// The kernel upcall server: receives the sandbox's requests on the main queue
// and answers each with one reply message.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/upcall_channel.h"

namespace kestrel {

inline constexpr std::uint32_t kKSTUpcallGetProcessContainersId = 322514900;
inline constexpr std::int32_t kKSTUpcallBadId = -303;

// The reply to one request datagram; nothing for a datagram too short to carry a header.
std::optional<std::vector<std::uint8_t>> KSTUpcallReceive(std::span<const std::uint8_t> request,
                                                          const platform::UpcallPeer& peer);

// A 36-byte error reply to the request whose header is given.
std::vector<std::uint8_t> KSTUpcallErrorReply(std::span<const std::uint8_t> requestHeader,
                                              std::int32_t returnCode);

}  // namespace kestrel
