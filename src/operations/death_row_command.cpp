// Command 4: destroy what is on death row. The reply goes out from the
// sweep's completion, on the death-row queue, once the sweep has ended.
#include "daemon/command_handlers.h"

namespace kestrel {

void KSTHandleDeleteDeathRow(KSTCommandContext& context) {
  // Both outlive the request's handler: copies go with the completion.
  KSTDeferredReply deferred = context.deferredReply;
  platform::MessageDictionary reply = context.reply;
  context.client.deleteContainersOnDeathRowWithCompletion(
      [deferred = std::move(deferred), reply = std::move(reply)](std::uint64_t code) {
        deferred.send(reply, code);
      });
}

}  // namespace kestrel
