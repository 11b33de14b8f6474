// Commands 8 and 22: recreate a container's default structure; 9: give its
// directory a new UUID; 23: measure its disk usage.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleRecreateDefaultStructure(KSTCommandContext& context) {
  const std::optional<KSTContainerRequest> request =
      KSTDecodeContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.recreateDefaultStructureForUser(
      request->userId, request->uuid, request->identifier, request->containerClass, context.error);
}

void KSTHandleRegenerateDirectoryUUID(KSTCommandContext& context) {
  const std::optional<KSTContainerRequest> request =
      KSTDecodeContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.regenerateDirectoryUUIDForUser(request->userId, request->uuid, request->identifier,
                                                request->containerClass, context.error);
}

void KSTHandleDiskUsage(KSTCommandContext& context) {
  const std::optional<KSTContainerRequest> request =
      KSTDecodeContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  // Sent also when the measurement failed (then 0).
  const std::uint64_t bytes = context.client.diskUsageForUserId(
      request->userId, request->uuid, request->identifier, request->containerClass, context.error);
  KSTEncodeDiskUsageReply(bytes, &context.reply);
}

}  // namespace kestrel
