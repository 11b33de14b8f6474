// Request dispatch and client admission: every message of every peer
// connection passes through KSTProcessVexelEvent on the listener queue.
#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "daemon/client_connection.h"
#include "platform/message_ipc.h"
#include "store/container_class.h"

namespace kestrel {

// Entitlement keys that admit a client to a command.
inline constexpr const char* kKSTEntitlementNone = "com.zorvane.private.Kestrel.none";
inline constexpr const char* kKSTEntitlementAllowed = "com.zorvane.private.Kestrel.allowed";
inline constexpr const char* kKSTEntitlementWipeContainer = "com.zorvane.private.Kestrel.wipeContainer";
inline constexpr const char* kKSTEntitlementDataMigration = "com.zorvane.private.Kestrel.dataMigration";
inline constexpr const char* kKSTEntitlementStageSharedContent =
    "com.zorvane.private.Kestrel.stageSharedContent";
inline constexpr const char* kKSTEntitlementOtherIdLookup = "com.zorvane.private.Kestrel.otherIdLookup";

inline constexpr const char* kKSTCommandKey = "Command";
inline constexpr const char* kKSTReplyErrorKey = "ReplyError";
inline constexpr std::uint64_t kKSTCommandCount = 27;

// Sends the reply of a command whose handler answers later (reply flag 0),
// from its completion, on any thread. "ReplyError" is set to the code.
class KSTDeferredReply {
 public:
  KSTDeferredReply(std::shared_ptr<platform::MessageConnection> connection,
                   platform::ReceivedMessage request)
      : connection_(std::move(connection)), request_(std::move(request)) {}
  void send(platform::MessageDictionary reply, std::uint64_t code) const;

 private:
  std::shared_ptr<platform::MessageConnection> connection_;
  platform::ReceivedMessage request_;
};

// What a command handler gets: the request, the reply to fill, the client and
// the request's code (starts at 1; the handler leaves or overwrites it).
struct KSTCommandContext {
  const platform::MessageDictionary& request;
  platform::MessageDictionary& reply;
  KSTClientConnection& client;
  std::uint64_t* error;
  // For the commands that reply later.
  const KSTDeferredReply& deferredReply;
};

using KSTCommandHandler = void (*)(KSTCommandContext& context);

struct KSTCommandRow {
  std::uint64_t index;
  // nullptr while the command's operation is not available in this build of the daemon.
  KSTCommandHandler handler;
  const char* entitlement;
  // 1: the dispatcher replies when the handler returns; 0: the handler's completion replies.
  int replyFlag;
};

const std::array<KSTCommandRow, kKSTCommandCount>& KSTCommandTable();

// The event handler of each peer connection.
void KSTProcessVexelEvent(std::shared_ptr<platform::MessageConnection> connection,
                          platform::ReceivedMessage message);

// Admits or refuses the client for the row; nothing when refused.
std::unique_ptr<KSTClientConnection> checkEntitlementsAndInitClientObject(
    const platform::MessageConnection& connection, const KSTCommandRow& row);

// Resolves the user id a request names for the class, for a client of the
// given user id. On failure logs, sets the code (when given) to 38 and leaves
// the resolved id alone.
bool validateUserId(std::uint32_t requestedUserId, KSTContainerClass containerClass,
                    std::uint32_t clientUserId, std::uint32_t* resolvedUserId,
                    std::uint64_t* error);

// Opens the listener for "com.zorvane.kestreld" on the queue; false when it cannot be made.
bool KSTStartRequestListener(std::shared_ptr<platform::DispatchQueue> queue);

}  // namespace kestrel
