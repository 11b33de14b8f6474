// Commands 19 and 20: reading an identifier's code-signing information and
// invalidating the information of applications whose bundle has gone.
#include "codesigning/code_signing_mapping.h"
#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"

namespace kestrel {

void KSTHandleGetCodeSigningInfo(KSTCommandContext& context) {
  const std::optional<std::string> identifier = context.request.string("Identifier");
  std::optional<PlistDictionary> info;
  if (identifier)
    info = KSTCodeSigningMapping::sharedInstance().getCodeSigningInfoForIdentifier(*identifier);
  if (!info || !context.reply.setPlist("ReplyInfoDictionary", PlistValue(std::move(*info)))) {
    KSTSetCode(context.error, kKSTErrorNotFound);
  }
}

void KSTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(KSTCommandContext& context) {
  KSTSetCode(context.error, KSTCodeSigningMapping::sharedInstance()
                                .invalidateCodeSigningInfoForAppsWithoutBundleContainer());
}

}  // namespace kestrel
