// Commands 5 and 6: set and get one info value of a container; 7: a
// container's metadata record.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"
#include "daemon/log.h"

namespace kestrel {

void KSTHandleSetInfoValue(KSTCommandContext& context) {
  const std::optional<KSTSetInfoValueRequest> request =
      KSTDecodeSetInfoValueRequest(context.request, context.client, context.error);
  if (!request) return;
  context.client.setInfoValue(request->value, request->key, request->userId, request->uuid,
                              request->identifier, request->containerClass, true, context.error);
}

void KSTHandleGetInfoValue(KSTCommandContext& context) {
  const std::optional<KSTInfoValueRequest> request =
      KSTDecodeInfoValueRequest(context.request, context.client, context.error);
  if (!request) return;
  const std::optional<PlistValue> value = context.client.infoValueForKey(
      request->key, request->userId, request->uuid, request->identifier, request->containerClass,
      true, context.error);
  if (value && !KSTEncodePlistReply("ReplyInfoValue", *value, &context.reply)) {
    KSTLog(kLogError, "Info value for key %@ is nested too deep to send", request->key);
  }
}

void KSTHandleGetMetadata(KSTCommandContext& context) {
  const std::optional<KSTMetadataRequest> request =
      KSTDecodeMetadataRequest(context.request, context.client, context.error);
  if (!request) return;
  const KSTMetadataRef container = context.client.metadataForUser(
      request->userId, request->uuid, request->identifier, request->containerClass, context.error);
  if (container) KSTEncodeMetadataReply(*container, request->infoDictRequested, &context.reply);
}

}  // namespace kestrel
