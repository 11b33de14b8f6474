#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"
#include "daemon/log.h"
#include "platform/services.h"

namespace kestrel {

void KSTHandleRetryTest(KSTCommandContext& context) {
  auto request = KSTDecodeRetryTestRequest(context.request, context.client, context.error);
  if (!request) return;
  if (!platform::services().deviceInfo->isInternalBuild()) {
    KSTLogTag(kLogError, "retryTest",
              "People really shouldn't be calling this on non-internal installs!");
    return;
  }
  context.client.retryTestForUser(request->userId, request->numRetryCrashes, context.error);
}

bool KSTCommandIsAvailable(const KSTCommandRow& row) {
  return row.handler != nullptr;
}

}  // namespace kestrel
