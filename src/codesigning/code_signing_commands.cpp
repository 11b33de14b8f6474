// Commands 18, 19 and 20: processing new code-signing information, reading an
// identifier's information and invalidating the information of applications
// whose bundle has gone.
#include "codesigning/code_signing_mapping.h"
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"

namespace kestrel {

namespace {

// The information and the options arrive as any property list. Only a
// dictionary is taken; anything else counts as none (for the information,
// that means removal).
std::optional<PlistDictionary> dictionaryOrNone(std::optional<PlistValue> value, const char* key) {
  if (!value) return std::nullopt;
  if (PlistDictionary* dictionary = value->dictionary()) return std::move(*dictionary);
  KSTLogTag(kLogNotice, "processCodeSigningInfo", "Ignoring %s that is not a dictionary: %@", key,
            *value);
  return std::nullopt;
}

}  // namespace

void KSTHandleProcessCodeSigningInfo(KSTCommandContext& context) {
  auto request = KSTDecodeProcessCodeSigningInfoRequest(context.request, context.error);
  if (!request) return;
  KSTSetCode(
      context.error,
      KSTCodeSigningMapping::sharedInstance().processCodeSigningInfo(
          dictionaryOrNone(std::move(request->codeSigningInfo), "CodeSigningInfo"),
          request->identifier, dictionaryOrNone(std::move(request->options), "OptionsDictionary")));
}

void KSTHandleGetCodeSigningInfo(KSTCommandContext& context) {
  auto request = KSTDecodeIdentifierRequest(context.request, context.error);
  if (!request) return;
  std::optional<PlistDictionary> info;
  if (request->identifier) {
    info = KSTCodeSigningMapping::sharedInstance().getCodeSigningInfoForIdentifier(
        *request->identifier);
  }
  if (!info || !context.reply.setPlist("ReplyInfoDictionary", PlistValue(std::move(*info)))) {
    KSTSetCode(context.error, kKSTErrorNotFound);
  }
}

void KSTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(KSTCommandContext& context) {
  KSTSetCode(context.error, KSTCodeSigningMapping::sharedInstance()
                                .invalidateCodeSigningInfoForAppsWithoutBundleContainer());
}

}  // namespace kestrel
