// KSTContainerMigrator brings a store written by an older release up to the
// current layout. At the first start after boot (rebootContainerManagerSetup)
// it moves files out of the places older releases used; when the
// data-migration service asks (command 24) it fixes the ownership of bundle
// content and the ACLs of system containers, then has the code-signing store
// take over older code-signing data.
//
// The work that must be done only once per device is marked done by a file
// in the library directory (the markers below). A marker records the build
// version and the time it was written; only its existence is ever checked.
// Removing a marker makes its migration run again at the next command 24.
#pragma once

#include <string>
#include <string_view>

#include "daemon/errors.h"
#include "store/file_url.h"

namespace kestrel {

inline constexpr const char* kKSTBundleMigrationMarker = "kst_bundle_migration_complete.plist";
inline constexpr const char* kKSTACLMigrationMarker = "kst_acl2_migration_complete.plist";
inline constexpr const char* kKSTGroupIdMigrationMarker = "kst_group_id_migration_complete.plist";
inline constexpr const char* kKSTCodeSigningMigrationMarker =
    "kst_code_signing_migration_complete.plist";
// Keys of a marker file.
inline constexpr const char* kKSTMigrationVersionNumberKey = "KSTMigrationVersionNumber";
inline constexpr const char* kKSTMigrationTimeKey = "KSTMigrationTime";
// Where older releases kept the bundle containers (beneath the root).
inline constexpr const char* kKSTOldBundleContainerDirectory =
    "/private/var/mobile/Containers/Bundle";

class KSTContainerMigrator {
 public:
  static KSTContainerMigrator& sharedInstance();

  KSTContainerMigrator(const KSTContainerMigrator&) = delete;
  KSTContainerMigrator& operator=(const KSTContainerMigrator&) = delete;

  // Boot-time setup: the old library and log directories of user 501 (not on
  // a multi-user host), the old bundle container directory, and the
  // well-known system containers into their fixed places. False when the
  // bundle directory or a well-known container could not be moved.
  bool performSynchronousDaemonStartupMigrationWithError(KSTErrorRef* error);
  // Command 24: ACLs of system containers, ownership of bundle content (each
  // once per device), then every code-signing migration and the
  // reconciliation of application group containers. False with the last
  // error of the first two; the code-signing part reports nothing.
  bool performDataMigratorMigrationWithError(KSTErrorRef* error);

  // Writes the marker `name` into the library directory, or into atURL. A
  // failure is logged only: the migration then runs again next time.
  void writeMigrationFileToDiskWithName(std::string_view name);
  void writeMigrationFileToDiskWithName(std::string_view name, const KSTFileURL& atURL);

  // The system's build version, read once per process ("Unknown" without one).
  const std::string& _getCurrentBuildVersion();

  bool _performBundleContainerOwnershipMigrationWithError(KSTErrorRef* error);
  bool _performInternalACLMigrationWithError(KSTErrorRef* error);
  bool _performWhitelistMigrationWithError(KSTErrorRef* error);

 private:
  KSTContainerMigrator() = default;
};

}  // namespace kestrel
