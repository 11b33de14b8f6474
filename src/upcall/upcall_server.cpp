#include "upcall/upcall_server.h"

#include <cstring>
#include <memory>
#include <string>

#include "daemon/daemon_state.h"
#include "daemon/log.h"
#include "daemon/startup.h"
#include "platform/services.h"

namespace kestrel {

namespace {

constexpr std::size_t kHeaderSize = 24;
constexpr std::size_t kErrorReplySize = 36;
constexpr std::uint8_t kNDRRecord[8] = {0, 0, 0, 0, 1, 0, 0, 0};

std::uint32_t readWord(std::span<const std::uint8_t> bytes, std::size_t offset) {
  std::uint32_t value = 0;
  for (std::size_t i = 0; i < 4; ++i) value |= std::uint32_t(bytes[offset + i]) << (8 * i);
  return value;
}

void writeWord(std::vector<std::uint8_t>& bytes, std::size_t offset, std::uint32_t value) {
  for (std::size_t i = 0; i < 4; ++i) bytes[offset + i] = std::uint8_t(value >> (8 * i));
}

}  // namespace

std::vector<std::uint8_t> KSTUpcallErrorReply(std::span<const std::uint8_t> requestHeader,
                                              std::int32_t returnCode) {
  std::vector<std::uint8_t> reply(kErrorReplySize, 0);
  writeWord(reply, 0, readWord(requestHeader, 0) & 0x1f);  // the reply-port disposition only
  writeWord(reply, 4, kErrorReplySize);
  writeWord(reply, 8, readWord(requestHeader, 8));  // back to the request's reply port
  writeWord(reply, 20, readWord(requestHeader, 20) + 100);
  std::memcpy(reply.data() + 24, kNDRRecord, sizeof kNDRRecord);
  writeWord(reply, 32, static_cast<std::uint32_t>(returnCode));
  return reply;
}

std::optional<std::vector<std::uint8_t>> KSTUpcallReceive(std::span<const std::uint8_t> request,
                                                          const platform::UpcallPeer& /*peer*/) {
  if (request.size() < kHeaderSize) return std::nullopt;
  const std::uint32_t id = readWord(request, 20);
  KSTLogTag(kLogDebug, "demux_server", "%u", id);
  // No routine is served yet: every message gets the "bad id" answer.
  return KSTUpcallErrorReply(request, kKSTUpcallBadId);
}

bool KSTKernServerStart() {
  const auto& channel = platform::services().upcall;
  std::string errorText;
  std::shared_ptr<platform::UpcallPort> port =
      channel ? channel->checkIn(kKSTUpcallServiceName, &errorText) : nullptr;
  if (!port) {
    KSTLog(kLogError, "%s", errorText);
    KSTLog(kLogError, "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
    return false;
  }
  // Kept for the life of the process, like the port it receives on.
  static std::unique_ptr<platform::ReadSource> source;
  source = channel->createReceiveSource(port, platform::DispatchQueue::main(), KSTUpcallReceive);
  if (!source) {
    KSTLog(kLogError, "Failed to create receive source for %s", kKSTUpcallServiceName);
    KSTLog(kLogError, "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
    return false;
  }
  source->resume();
  return true;
}

}  // namespace kestrel
