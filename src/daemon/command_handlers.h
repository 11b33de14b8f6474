// The command handlers: each decodes its request keys, makes one call of an
// operation and encodes the reply keys. They live beside their operations.
#pragma once

#include "daemon/request_dispatch.h"

namespace kestrel {

// Whether this build of the daemon serves the row's command.
bool KSTCommandIsAvailable(const KSTCommandRow& row);

// 0: create or look up a container; 1: list the containers of a class.
void KSTHandleCreateOrLookupContainer(KSTCommandContext& context);
void KSTHandleListContainers(KSTCommandContext& context);

// 2: replaces a container by another.
void KSTHandleReplaceContainer(KSTCommandContext& context);

// 3: stages a batch of containers for deletion; 10: deletes one container.
void KSTHandleStageForDelete(KSTCommandContext& context);
void KSTHandleDeleteContainer(KSTCommandContext& context);
// 11: wipes a plug-in data container named by the client's wipe entitlement;
// 12: wipes a data container's content.
void KSTHandleWipePluginContainer(KSTCommandContext& context);
void KSTHandleWipeContainer(KSTCommandContext& context);

// 4: the death-row sweep; replies from its completion.
void KSTHandleDeleteDeathRow(KSTCommandContext& context);

// 5 and 6: set and get one info value of a container; 7: its metadata record.
void KSTHandleSetInfoValue(KSTCommandContext& context);
void KSTHandleGetInfoValue(KSTCommandContext& context);
void KSTHandleGetMetadata(KSTCommandContext& context);

// 8 and 22: recreate a container's default structure; 9: give its directory a
// new UUID; 23: its disk usage ("ReplyDiskUsage", also after a failure).
void KSTHandleRecreateDefaultStructure(KSTCommandContext& context);
void KSTHandleRegenerateDirectoryUUID(KSTCommandContext& context);
void KSTHandleDiskUsage(KSTCommandContext& context);

// 13: the app-group container paths of an identifier; 14: its app-group ids.
void KSTHandleAppGroupContainerPaths(KSTCommandContext& context);
void KSTHandleAppGroupIdentifiers(KSTCommandContext& context);

// 15: a system container's path.
void KSTHandleSystemContainerPath(KSTCommandContext& context);

// 16: the system group container paths of an identifier; 17: one system group
// container's path.
void KSTHandleSystemGroupContainerPaths(KSTCommandContext& context);
void KSTHandleSystemGroupContainerPath(KSTCommandContext& context);

// 18: processes new code-signing information (none: removal) for an identifier.
void KSTHandleProcessCodeSigningInfo(KSTCommandContext& context);
// 19: an identifier's code-signing information, as an external request sees it.
void KSTHandleGetCodeSigningInfo(KSTCommandContext& context);
// 20: invalidates the code-signing information of apps without a bundle container.
void KSTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(KSTCommandContext& context);

// 21: moves a data container's files to another protection class; replies
// from the change's completion.
void KSTHandleSetDataProtection(KSTCommandContext& context);

// 26: stages shared content inside a system group container.
void KSTHandleStageSharedContent(KSTCommandContext& context);

// 24: the data-migration migration (migration/data_migration_command.cpp).
void KSTHandleDataMigration(KSTCommandContext& context);

// 25: the retry test, on internal builds only.
void KSTHandleRetryTest(KSTCommandContext& context);

}  // namespace kestrel
