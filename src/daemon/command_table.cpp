// The 27 commands: index, handler, the entitlement that admits a client, and
// whether the dispatcher replies (1) or the handler's completion does (0).
#include "daemon/command_handlers.h"
#include "daemon/request_dispatch.h"

namespace kestrel {

const std::array<KSTCommandRow, kKSTCommandCount>& KSTCommandTable() {
  static const std::array<KSTCommandRow, kKSTCommandCount> table = {{
      {0, KSTHandleCreateOrLookupContainer, kKSTEntitlementNone,
       1},                                                        // create or look up a container
      {1, KSTHandleListContainers, kKSTEntitlementAllowed, 1},    // list the containers of a class
      {2, KSTHandleReplaceContainer, kKSTEntitlementAllowed, 1},  // replace a container by another
      {3, KSTHandleStageForDelete, kKSTEntitlementAllowed, 1},    // stage containers for deletion
      {4, KSTHandleDeleteDeathRow, kKSTEntitlementAllowed, 0},    // destroy what is on death row
      {5, KSTHandleSetInfoValue, kKSTEntitlementAllowed, 1},      // set an info value
      {6, KSTHandleGetInfoValue, kKSTEntitlementAllowed, 1},      // get an info value
      {7, KSTHandleGetMetadata, kKSTEntitlementAllowed, 1},       // get a container's metadata
      {8, KSTHandleRecreateDefaultStructure, kKSTEntitlementAllowed,
       1},  // recreate the default structure
      {9, KSTHandleRegenerateDirectoryUUID, kKSTEntitlementAllowed,
       1},                                                        // give a container a new UUID
      {10, KSTHandleDeleteContainer, kKSTEntitlementAllowed, 1},  // delete a container
      {11, KSTHandleWipePluginContainer, kKSTEntitlementWipeContainer,
       1},                                                      // wipe a plug-in data container
      {12, KSTHandleWipeContainer, kKSTEntitlementAllowed, 1},  // delete a data container's content
      {13, KSTHandleAppGroupContainerPaths, kKSTEntitlementNone,
       1},  // the client's app-group paths
      {14, KSTHandleAppGroupIdentifiers, kKSTEntitlementAllowed,
       1},                                                         // an identifier's app-group ids
      {15, KSTHandleSystemContainerPath, kKSTEntitlementNone, 1},  // a system container's path
      {16, KSTHandleSystemGroupContainerPaths, kKSTEntitlementNone,
       1},  // system group container paths
      {17, KSTHandleSystemGroupContainerPath, kKSTEntitlementNone,
       1},  // one system group container's path
      {18, KSTHandleProcessCodeSigningInfo, kKSTEntitlementAllowed,
       1},  // process code-signing information
      {19, KSTHandleGetCodeSigningInfo, kKSTEntitlementAllowed, 1},  // get code-signing information
      {20, KSTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer, kKSTEntitlementAllowed,
       1},  // invalidate apps without bundles
      {21, KSTHandleSetDataProtection, kKSTEntitlementAllowed, 0},  // set a container's protection
      {22, KSTHandleRecreateDefaultStructure, kKSTEntitlementAllowed,
       1},                                                  // recreate the default structure
      {23, KSTHandleDiskUsage, kKSTEntitlementAllowed, 1},  // measure disk usage
      {24, KSTHandleDataMigration, kKSTEntitlementDataMigration, 1},  // the data migration
      {25, KSTHandleRetryTest, kKSTEntitlementAllowed, 1},  // retry test (internal builds)
      {26, KSTHandleStageSharedContent, kKSTEntitlementStageSharedContent,
       1},  // stage shared content
  }};
  return table;
}

}  // namespace kestrel
