// Command 21: move a data container's files to another protection class. The
// reply goes out from the change's completion, which may come after the
// device's next unlock; a request that cannot be decoded is answered at once.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"
#include "protection/data_protection_manager.h"

namespace kestrel {

void KSTHandleSetDataProtection(KSTCommandContext& context) {
  // Both outlive the request's handler: copies go with the completion.
  KSTDeferredReply deferred = context.deferredReply;
  platform::MessageDictionary reply = context.reply;
  const std::optional<KSTDataProtectionRequest> request =
      KSTDecodeDataProtectionRequest(context.request, context.client, context.error);
  if (!request) {
    deferred.send(std::move(reply), *context.error);
    return;
  }
  KSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
      request->userId, request->identifier, request->containerClass, request->dataProtectionClass,
      request->isThirdParty, request->retryIfLocked,
      [deferred = std::move(deferred), reply = std::move(reply)](std::uint64_t code) {
        deferred.send(reply, code);
      });
}

}  // namespace kestrel
