// Commands 0 and 1: create or look up a container, and list a class.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleCreateOrLookupContainer(KSTCommandContext& context) {
  const std::optional<KSTCreateOrLookupRequest> request =
      KSTDecodeCreateOrLookupRequest(context.request, context.client, context.error);
  if (!request) return;
  const KSTMetadataRef container = context.client.createOrLookupContainerForUser(
      request->userId, request->identifier, request->createIfNecessary, request->containerClass,
      request->transient, true, context.error);
  if (container) KSTEncodeContainerReply(*container, &context.reply);
}

void KSTHandleListContainers(KSTCommandContext& context) {
  const std::optional<KSTListContainersRequest> request =
      KSTDecodeListContainersRequest(context.request, context.client, context.error);
  if (!request) return;
  const std::optional<std::vector<KSTMetadataRef>> containers = context.client.containersForUser(
      request->userId, request->containerClass, request->transient, context.error);
  if (containers) KSTEncodeContainerListReply(*containers, &context.reply);
}

}  // namespace kestrel
