// Commands 3 and 10: stage a batch of containers for deletion, and delete one
// container found by identifier; 11 and 12: wipe a data container's content.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleStageForDelete(KSTCommandContext& context) {
  const std::optional<KSTStageForDeleteRequest> request =
      KSTDecodeStageForDeleteRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.stageForDeleteContainersWithUsers(request->userIds, request->uuids,
                                                   request->identifiers, request->containerClasses,
                                                   true, context.error);
}

void KSTHandleDeleteContainer(KSTCommandContext& context) {
  const std::optional<KSTDeleteContainerRequest> request =
      KSTDecodeDeleteContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.deleteContainerForUser(request->userId, request->identifier,
                                        request->containerClass, request->transient, context.error);
}

void KSTHandleWipePluginContainer(KSTCommandContext& context) {
  // Only the identifiers of the client's wipe entitlement, whatever else it may name.
  context.client.setAllowOtherIdLookup(false);
  const std::optional<KSTWipeContainerRequest> request =
      KSTDecodeWipePluginContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.deleteDataContainerContentForUser(request->userId, request->identifier,
                                                   request->containerClass, context.error);
}

void KSTHandleWipeContainer(KSTCommandContext& context) {
  const std::optional<KSTWipeContainerRequest> request =
      KSTDecodeWipeContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.deleteDataContainerContentForUser(request->userId, request->identifier,
                                                   request->containerClass, context.error);
}

}  // namespace kestrel
