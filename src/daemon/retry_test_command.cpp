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
  // Internal builds run the crash-retry operation; the dispatcher does not
  // offer the command there until that operation exists (KSTCommandIsAvailable).
}

bool KSTCommandIsAvailable(const KSTCommandRow& row) {
  if (row.handler == nullptr) return false;
  if (row.index == 25) return !platform::services().deviceInfo->isInternalBuild();
  return true;
}

}  // namespace kestrel
