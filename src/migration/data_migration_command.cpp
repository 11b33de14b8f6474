// Command 24: the data-migration service asks for the store to be brought up
// to date.
#include "daemon/command_handlers.h"
#include "daemon/log.h"
#include "migration/container_migrator.h"

namespace kestrel {

void KSTHandleDataMigration(KSTCommandContext& context) {
  KSTErrorRef error;
  if (!KSTContainerMigrator::sharedInstance().performDataMigratorMigrationWithError(&error)) {
    KSTLogTag(kLogError, "performDataMigration", "Failed to perform data migration : %@", error);
    KSTHandOverCode(error, context.error);
  }
}

}  // namespace kestrel
