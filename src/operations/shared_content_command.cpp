// Command 26: stage shared content inside a system group container.
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"

namespace kestrel {

void KSTHandleStageSharedContent(KSTCommandContext& context) {
  const std::optional<KSTStageSharedContentRequest> request =
      KSTDecodeStageSharedContentRequest(context.request, context.error);
  if (!request) return;
  if (const std::optional<KSTFileURL> staged = context.client.stageSharedContentForIdentifier(
          request->identifier, request->sourcePath, request->destPath, context.error)) {
    KSTEncodePathReply(staged->path(), &context.reply);
  }
}

}  // namespace kestrel
