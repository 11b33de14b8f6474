// The kernel upcall server: receives the sandbox's messages on the main queue,
// one at a time, and answers each with one reply message.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/upcall_channel.h"

namespace kestrel {

// The receive handler: the reply to one message, or nothing when the message
// is not this server's.
std::optional<std::vector<std::uint8_t>> KSTUpcallReceive(const platform::UpcallMessage& request);

// The server's routine table: checks the message and runs its routine. False
// (reply untouched) when the message is not this server's.
bool demux_server(const platform::UpcallMessage& request, std::vector<std::uint8_t>* reply);

// The region of a successful reply.
struct KSTUpcallOutOfLine {
  std::vector<std::uint8_t> bytes;
  bool deallocate = false;  // set when the copy was made
};

// The sandbox's question, which containers the process has: 0 with the
// packed reply in `reply`, 4 for an unknown item, 5 for a request that cannot
// be read or a sender other than the kernel (pid 0), 9 without memory.
std::int32_t server_get_process_containers(pid_t senderPid, std::span<const std::uint8_t> request,
                                           KSTUpcallOutOfLine* reply);

}  // namespace kestrel
