// Start-up and boot-time housekeeping of the container store. Start-up calls
// these on the shared client connection, on the main thread, before the
// listener opens: every start finishes what the last run left half-done
// (journalled replaces, containers half-built in staging); the first start
// after boot also moves what older releases left in old places, restores
// system containers from a device backup, throws away every transient
// container and retires what does not belong in a class directory. Nothing is destroyed here: what
// goes is moved to death row, and the sweep started last destroys it.
#include <cerrno>

#include "codesigning/whitelist.h"
#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/log.h"
#include "migration/container_migrator.h"
#include "migration/system_container_restore.h"
#include "platform/crash_point.h"
#include "platform/services.h"
#include "platform/uuid.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"

namespace kestrel {

void KSTClientConnection::rebootContainerManagerSetup() {
  KSTErrorRef error;
  if (!KSTContainerMigrator::sharedInstance().performSynchronousDaemonStartupMigrationWithError(
          &error)) {
    KSTLog(kLogError, "Failed to perform daemon startup migration : %@", error);
  }
  KSTMoveSystemContainersIntoPlace(*this);
}

void KSTClientConnection::containerManagerSetup() {
  KSTErrorRef error;
  if (!_recoverFromReplaceOperationsWithError(&error)) {
    KSTLog(kLogError, "Failed recovering from replace operations");
  }
}

void KSTClientConnection::rebootContainerManagerCleanup() {
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  KSTErrorRef error;
  const KSTFileURL sharedTransient = layout.transientDirectory();
  if (!_moveItemAtURLToDeathRow(sharedTransient, true, false, &error)) {
    KSTLog(kLogError, "Failed to delete shared transient URL %@ : %@", sharedTransient, error);
  }
  const KSTFileURL transientBundles = layout.transientBundleDirectory();
  if (!_moveItemAtURLToDeathRow(transientBundles, true, false, &error)) {
    KSTLog(kLogError, "Failed to delete shared transient bundle URL %@ : %@", transientBundles,
           error);
  }

  const char* const operation = __func__;
  KSTForEachValidUserId([&](std::uint32_t userId) {
    const auto configuration = layout.getPerUserConfigurationForUserId(userId);
    if (!configuration || !configuration->existsUserBaseDirectory()) return;
    if (const std::optional<KSTFileURL> transient = configuration->transientDirectory()) {
      KSTErrorRef moveError;
      if (!_moveItemAtURLToDeathRow(*transient, true, false, &moveError)) {
        KSTLogTag(kLogError, operation, "Failed to delete per-user transient URL %@ : %@",
                  *transient, moveError);
      }
    }
    for (KSTContainerClass c = 1; c <= 13; ++c) {
      if (KSTIsPerUserClass(c)) _cleanupOrphanedDataForUser(userId, c);
    }
  });
  for (KSTContainerClass c = 1; c <= 13; ++c) {
    if (KSTIsBundleClass(c)) _cleanupOrphanedDataForUser(kKSTInstallerUserId, c);
    if (KSTIsSystemClass(c)) _cleanupOrphanedDataForUser(kKSTSystemContainerUserId, c);
  }
}

void KSTClientConnection::containerManagerCleanup() {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  const KSTFileURL staging = KSTGlobalConfiguration::sharedInstance().stagingDirectory();
  KSTErrorRef listError;
  if (const auto items = files.urlsForItemsInDirectoryAtURL(staging, &listError)) {
    // Half-built containers, and old containers parked by a replace that
    // recovery found complete.
    for (const KSTFileURL& item : *items) {
      _moveItemAtURLToDeathRow(item, true, false, nullptr);
      KST_CRASH_POINT("cleanup.staging-retired");
    }
  } else if (!listError || !listError->isPOSIXError(ENOENT)) {
    KSTLog(kLogError, "Failed to get items at staging URL%@ : %@", staging, listError);
  }
  deleteContainersOnDeathRowWithCompletion(nullptr);
}

void KSTClientConnection::_cleanupOrphanedDataForUser(std::uint32_t userId,
                                                      KSTContainerClass containerClass) {
  const std::optional<KSTFileURL> classDirectory =
      KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, containerClass,
                                                                            false);
  if (!classDirectory) return;
  const KSTFileManager& files = KSTFileManager::defaultManager();
  KSTErrorRef listError;
  const auto items = files.urlsForItemsInDirectoryAtURL(*classDirectory, &listError);
  if (!items) {
    if (!listError || !listError->isPOSIXError(ENOENT)) {
      KSTLog(kLogError, "Failed to get items at %@ : %@", *classDirectory, listError);
    }
    return;
  }
  const KSTWhitelist& whitelist = KSTWhitelist::sharedWhitelist();
  for (const KSTFileURL& item : *items) {
    const std::string name = item.lastPathComponent();
    const bool candidate = platform::Uuid::parse(name).has_value() ||
                           (containerClass == kKSTContainerClassDataSystem &&
                            whitelist.systemContainerIdIsWellknown(name)) ||
                           (containerClass == kKSTContainerClassSharedSystemGroup &&
                            whitelist.systemGroupContainerIdIsWellknown(name));
    if (candidate) {
      // A metadata file that is there, or cannot be tested, keeps the container.
      if (!files.itemDoesNotExistAtURL(KSTMetadata::metadataFileURL(item))) continue;
      KSTLog(kLogError, "Deleting orphaned data missing a metadata file at: %@", item);
    }
    if (platform::services().deviceInfo->isInternalBuild()) {
      KSTLog(kLogError,
             "\tSomeone is writing invalid data to a container, which has now been orphaned. "
             "Here are the invalid files:");
      files.printDirectoryStructureAtURL(item);
      KSTLog(kLogError, "***END INTERNAL BUILD REQUEST");
    }
    _moveItemAtURLToDeathRow(item, true, false, nullptr);
  }
}

}  // namespace kestrel
