// Command 15: the path of a system container. A well-known system container
// may be asked for by any client; any other only by its owner, and only while
// the owner's entitlements give it one.
#include "codesigning/whitelist.h"
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleSystemContainerPath(KSTCommandContext& context) {
  const std::optional<KSTOwnIdentifierRequest> request =
      KSTDecodeOwnIdentifierRequest(context.request, context.client, context.error);
  if (!request) return;
  KSTClientConnection& client = context.client;
  const std::optional<std::string>& identifier = request->identifier;
  if (identifier && identifier != client.clientBundleIdentifier() && !client.allowOtherIdLookup() &&
      KSTWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier)) {
    client.setAllowOtherIdLookup(true);
  }
  const KSTMetadataRef container = client.createOrLookupContainerForUser(
      kKSTSystemContainerUserId, identifier, true, kKSTContainerClassDataSystem, false, true,
      context.error);
  if (container) KSTEncodePathReply(container->url().path(), &context.reply);
}

}  // namespace kestrel
