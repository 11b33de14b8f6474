// Commands 3 and 10: stage a batch of containers for deletion, and delete one
// container found by identifier.
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

}  // namespace kestrel
