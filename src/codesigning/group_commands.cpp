// Commands 13, 14, 16 and 17: the group containers of the client's own
// identifier (or of the identifier it names), and one system group
// container's path.
#include <algorithm>

#include "codesigning/code_signing_mapping.h"
#include "codesigning/group_manager.h"
#include "codesigning/whitelist.h"
#include "daemon/command_handlers.h"
#include "daemon/command_requests.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"

namespace kestrel {
namespace {

constexpr const char* kGroupContainerDictReplyKey = "ReplyGroupContainerDict";
constexpr const char* kSystemGroupPathLogTag = "systemGroupContainerPath";

void encodeGroupPaths(const std::optional<PlistDictionary>& paths,
                      platform::MessageDictionary* reply) {
  if (paths) KSTEncodePlistReply(kGroupContainerDictReplyKey, PlistValue(*paths), reply);
}

bool contains(const KSTGroupIdentifiers& groups, const std::string& group) {
  return groups && std::find(groups->begin(), groups->end(), group) != groups->end();
}

}  // namespace

void KSTHandleAppGroupContainerPaths(KSTCommandContext& context) {
  const std::optional<KSTAppGroupRequest> request =
      KSTDecodeAppGroupRequest(context.request, context.client, context.error);
  if (!request) return;
  encodeGroupPaths(KSTGroupManager::defaultManager().groupContainerPathsForUser(
                       request->userId, context.client, request->identifier, context.error),
                   &context.reply);
}

void KSTHandleAppGroupIdentifiers(KSTCommandContext& context) {
  const std::optional<KSTAppGroupRequest> request =
      KSTDecodeAppGroupRequest(context.request, context.client, context.error);
  if (!request) return;
  const std::optional<PlistArray> groups =
      KSTGroupManager::defaultManager().groupContainerIdentifiersForUser(
          request->userId, request->identifier, context.error);
  if (groups)
    KSTEncodePlistReply("ReplyGroupIdentifiersArray", PlistValue(*groups), &context.reply);
}

void KSTHandleSystemGroupContainerPaths(KSTCommandContext& context) {
  const std::optional<KSTOwnIdentifierRequest> request =
      KSTDecodeOwnIdentifierRequest(context.request, context.client, context.error);
  if (!request) return;
  encodeGroupPaths(
      KSTGroupManager::defaultManager().groupContainerPathsForUser(
          kKSTSystemContainerUserId, context.client, request->identifier, context.error),
      &context.reply);
}

void KSTHandleSystemGroupContainerPath(KSTCommandContext& context) {
  const std::optional<KSTSystemGroupPathRequest> request =
      KSTDecodeSystemGroupPathRequest(context.request, context.client, context.error);
  if (!request) return;
  KSTClientConnection& client = context.client;
  const std::optional<std::string>& group = request->groupIdentifier;

  // 1. The system groups that the client's own entitlements give it.
  KSTGroupIdentifiers entitled;
  if (client.clientBundleIdentifier()) {
    entitled = KSTCodeSigningMapping::sharedInstance().systemGroupIdentifiersForIdentifier(
        *client.clientBundleIdentifier());
  }

  std::optional<std::string> path;
  if (group && contains(entitled, *group)) {
    // 2. An entitled group: its path among the own identifier's group paths.
    const std::optional<PlistDictionary> paths =
        KSTGroupManager::defaultManager().groupContainerPathsForUser(
            kKSTSystemContainerUserId, client, request->identifier, context.error);
    if (paths) {
      if (auto it = paths->find(*group); it != paths->end() && it->second.string()) {
        path = *it->second.string();
      }
    }
  } else if (group && KSTWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group)) {
    // 3. A well-known group may be asked for by anyone.
    client.setAllowGroupIdLookup(true);
    const KSTMetadataRef container = client.createOrLookupContainerForUser(
        kKSTSystemContainerUserId, group, true, kKSTContainerClassSharedSystemGroup, false, true,
        context.error);
    if (container) path = container->url().path();
  } else {
    // 4. Neither.
    KSTLogTag(kLogError, kSystemGroupPathLogTag,
              "%@ is not entitled for system group identifier: %@", client.clientBundleIdentifier(),
              group);
    KSTSetCode(context.error, kKSTErrorNotEntitled);
    return;
  }

  // 5. The reply.
  if (path) {
    KSTEncodePathReply(*path, &context.reply);
    return;
  }
  KSTLogTag(kLogError, kSystemGroupPathLogTag,
            "Did not find system group container with identifier: %@ for %@", group,
            request->identifier);
  KSTSetCode(context.error, kKSTErrorNotFound);
}

}  // namespace kestrel
