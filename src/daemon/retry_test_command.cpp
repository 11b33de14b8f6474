#include "daemon/command_handlers.h"
#include "daemon/log.h"
#include "platform/services.h"

namespace kestrel {

void KSTHandleRetryTest(KSTCommandContext& context) {
  std::uint32_t userId = 0;
  const auto requested = static_cast<std::uint32_t>(context.request.uint64("UserID"));
  if (!validateUserId(requested, kKSTContainerClassDataApplication, context.client.clientUserId(),
                      &userId, context.error)) {
    return;
  }
  if (!platform::services().deviceInfo->isInternalBuild()) {
    KSTLogTag(kLogError, "retryTest", "People really shouldn't be calling this on non-internal installs!");
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
