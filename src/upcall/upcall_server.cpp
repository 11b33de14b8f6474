#include "upcall/upcall_server.h"

#include <memory>
#include <string>

#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "daemon/startup.h"
#include "platform/services.h"
#include "upcall/upcall_messages.h"

namespace kestrel {

namespace {

using namespace upcall_field;

// The sender's pid from the audit token in the trailer; -1 when the trailer
// is too short to hold one.
pid_t senderPid(std::span<const std::uint8_t> trailer) {
  const std::size_t end =
      platform::kUpcallTrailerAuditTokenOffset + platform::kUpcallAuditTokenSize;
  if (trailer.size() < end || KSTUpcallWord(trailer, 4) < end) return -1;
  return platform::upcallAuditTokenPid(
      trailer.subspan(platform::kUpcallTrailerAuditTokenOffset, platform::kUpcallAuditTokenSize));
}

// What the channel could not deliver or could not make sense of.
void KSTUpcallChannelProblem(const std::string& what) {
  KSTLog(kLogError, "%s", what);
}

}  // namespace

bool demux_server(const platform::UpcallMessage& request, std::vector<std::uint8_t>* reply) {
  const std::span<const std::uint8_t> message = request.message();
  const std::uint32_t id = KSTUpcallWord(message, kId);
  KSTLogTag(kLogDebug, kKSTUpcallServerTag, "message id %u", id);
  if (id != kKSTUpcallProcessContainersId && id != kKSTUpcallUnservedId) return false;
  if (id == kKSTUpcallUnservedId) {
    *reply = KSTUpcallErrorReply(message, kKSTUpcallBadId);
    return true;
  }

  const std::uint32_t bits = KSTUpcallWord(message, kBits);
  const std::uint32_t size = KSTUpcallWord(message, kOutOfLineSize);
  const std::span<const std::uint8_t> trailer = message.size() > kKSTUpcallMessageSize
                                                    ? message.subspan(kKSTUpcallMessageSize)
                                                    : std::span<const std::uint8_t>();
  std::optional<std::span<const std::uint8_t>> region;
  std::int32_t code = 0;
  if ((bits & kKSTUpcallComplexBit) == 0 || KSTUpcallWord(message, kDescriptorCount) != 1 ||
      KSTUpcallWord(message, kSize) != kKSTUpcallMessageSize) {
    code = kKSTUpcallBadArguments;
  } else if (message[kDescriptorType] != kKSTUpcallOutOfLineDescriptor ||
             size != KSTUpcallWord(message, kRepeatedSize) ||
             !(region = request.outOfLine(KSTUpcallWord(message, kAddress), size))) {
    code = kKSTUpcallTypeError;  // not out-of-line memory, or no region of the message
  } else if (trailer.size() < 8 ||
             KSTUpcallWord(trailer, 0) != platform::kUpcallTrailerFormatDefault ||
             KSTUpcallWord(trailer, 4) < 32) {
    code = kKSTUpcallTrailerError;
  }
  if (code != 0) {
    *reply = KSTUpcallErrorReply(message, code);
    return true;
  }

  KSTUpcallOutOfLine packed;
  code = server_get_process_containers(senderPid(trailer), *region, &packed);
  // The request's region goes with the message.
  if (code != 0) {
    *reply = KSTUpcallErrorReply(message, code);
  } else {
    *reply = KSTUpcallComplexMessage(bits, KSTUpcallWord(message, kRemotePort),
                                     id + kKSTUpcallReplyIdDelta, packed.bytes, packed.deallocate);
  }
  KSTLogTag(kLogDebug, kKSTUpcallServerTag, "kestrel_store server returns: %d", true);
  return true;
}

std::optional<std::vector<std::uint8_t>> KSTUpcallReceive(const platform::UpcallMessage& request) {
  std::uint64_t code = kKSTSuccess;
  return KST_CATCH_EXCEPTIONS(&code, std::optional<std::vector<std::uint8_t>>(),
                              [&]() -> std::optional<std::vector<std::uint8_t>> {
                                std::vector<std::uint8_t> reply;
                                if (!demux_server(request, &reply)) return std::nullopt;
                                return reply;
                              });
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
  source =
      channel->createReceiveSource(port, platform::DispatchQueue::main(), kKSTUpcallMessageSize,
                                   KSTUpcallReceive, KSTUpcallChannelProblem);
  if (!source) {
    KSTLog(kLogError, "Failed to create receive source for %s", kKSTUpcallServiceName);
    KSTLog(kLogError, "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
    return false;
  }
  source->resume();
  return true;
}

}  // namespace kestrel
