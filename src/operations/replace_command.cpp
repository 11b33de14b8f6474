// Command 2: replace a container by another, without preserving the old UUID
// and without starting a sweep.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleReplaceContainer(KSTCommandContext& context) {
  const std::optional<KSTReplaceContainerRequest> request =
      KSTDecodeReplaceContainerRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.replaceContainer(request->oldContainerUUID, request->newContainerUUID,
                                  request->oldUserId, request->newUserId, request->oldIdentifier,
                                  request->newIdentifier, request->oldContainerClass,
                                  request->newContainerClass, false, false, context.error);
}

}  // namespace kestrel
