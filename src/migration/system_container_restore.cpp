#include "migration/system_container_restore.h"

#include "daemon/client_connection.h"
#include "daemon/log.h"
#include "platform/services.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"

namespace kestrel {
namespace {

KSTFileURL withExtension(const KSTFileURL& url, std::string_view extension) {
  return KSTFileURL(url.path() + "." + std::string(extension), true);
}

// Renames a backup directory to its work name, after removing a work
// directory left by an earlier start. True when there is something to install.
bool moveToWorkDirectory(const KSTFileURL& backup, const KSTFileURL& work,
                         const char* moveFailure) {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  if (!files.itemExistsAtURL(backup)) return false;
  KSTErrorRef error;
  if (!files.removeItemAtURL(work, &error)) {
    KSTLogTag(kLogError, "KSTMoveSystemContainersIntoPlace",
              "Failed to remove existing inprogress system containers: %@", error);
  }
  error = nullptr;
  if (!files.moveItemAtURL(backup, work, &error)) {
    KSTLogTag(kLogError, "KSTMoveSystemContainersIntoPlace", moveFailure, error);
    return false;
  }
  return true;
}

void installAll(const KSTFileURL& work, KSTContainerClass containerClass,
                KSTClientConnection& clientConnection, const char* listFailure) {
  KSTErrorRef error;
  const auto restored = KSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(work, &error);
  if (!restored) {
    KSTLogTag(kLogError, "KSTMoveSystemContainersIntoPlace", listFailure, work, error);
    return;
  }
  for (const KSTFileURL& directory : *restored) {
    _moveSystemContainerIntoPlace(directory, containerClass, clientConnection);
  }
}

}  // namespace

void KSTMoveSystemContainersIntoPlace(KSTClientConnection& clientConnection) {
  const auto user =
      KSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForCurrentMobileUser();
  if (!user) return;
  const auto base = user->systemContainerBackupBaseDirectory();
  const auto data = user->systemContainerBackupDirectory();
  const auto shared = user->systemGroupContainerBackupDirectory();
  if (!base || !data || !shared) return;

  const KSTFileURL dataWork = withExtension(*data, "inprogress");
  const KSTFileURL sharedWork = withExtension(*shared, "inprogress");
  const bool installSystemContainers =
      moveToWorkDirectory(*data, dataWork, "Failed to move system containers to inprogress: %@");
  const bool installSystemGroupContainers = moveToWorkDirectory(
      *shared, sharedWork, "Failed to move shared system containers to inprogress: %@");

  if (installSystemContainers) {
    KSTLog(kLogError, "Installing system containers");
    installAll(dataWork, kKSTContainerClassDataSystem, clientConnection,
               "Couldn't find any system containers at %@: %@");
  }
  if (installSystemGroupContainers) {
    KSTLog(kLogError, "Installing system group containers");
    installAll(sharedWork, kKSTContainerClassSharedSystemGroup, clientConnection,
               "Couldn't find any system shared containers at %@: %@");
  }

  // An internal build keeps the backup, with what failed, for inspection.
  if (platform::services().deviceInfo->isInternalBuild()) return;
  KSTErrorRef error;
  if (!KSTFileManager::defaultManager().removeItemAtURL(*base, &error)) {
    KSTLog(kLogError, "Failed to remove system container base dir %@: %@", *base, error);
  }
}

void _moveSystemContainerIntoPlace(const KSTFileURL& restoredDirectory,
                                   KSTContainerClass containerClass,
                                   KSTClientConnection& clientConnection) {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  const std::string name = restoredDirectory.lastPathComponent();
  const KSTFileURL failedDirectory =
      withExtension(restoredDirectory.deletingLastPathComponent(), "failed").appending(name, true);

  std::uint64_t code = kKSTSuccess;
  const KSTMetadataRef container = clientConnection.createOrLookupContainerForUser(
      kKSTSystemContainerUserId, name, true, containerClass, false, true, &code);
  if (code != kKSTSuccess || !container) {
    KSTLog(kLogError, "Failed to create system container %@: %llu", name,
           static_cast<unsigned long long>(code));
    return;
  }
  const KSTFileURL destination = container->url();
  KSTLog(kLogError, "Restoring container for %@ at %@ to %@", name, restoredDirectory, destination);

  KSTErrorRef error;
  const auto entries = files.urlsForItemsInDirectoryAtURL(restoredDirectory, &error);
  if (!entries) {
    KSTLog(kLogError, "Failed to enumerate contents of restored system container %@ at %@: %@",
           name, restoredDirectory, error);
    return;
  }
  for (const KSTFileURL& entry : *entries) {
    const std::string entryName = entry.lastPathComponent();
    const KSTFileURL target = destination.appending(entryName, entry.isDirectory());
    KSTErrorRef stepError;
    if (!files.removeItemAtURL(target, &stepError)) {
      KSTLog(kLogError, "Failed to remove destination %@:%@: %@", name, target, stepError);
      _moveFailedPathAside(entry, failedDirectory, entryName);
      continue;
    }
    if (!files.moveItemAtURL(entry, target, &stepError)) {
      KSTLog(kLogError,
             "Failed to move file in restored system container %@:%@ to destination %@: %@", name,
             entry, target, stepError);
      _moveFailedPathAside(entry, failedDirectory, entryName);
    }
  }
  // The restored items still carry the owners and modes they had in the
  // mobile user's backup; the repair gives them those of every system
  // container item (so the user cannot keep writing into a system container)
  // and puts back the sub-directories the backup lacked.
  std::uint64_t repaired = kKSTSuccess;
  clientConnection.recreateDefaultStructureForUser(container->uid(), container->uuid(),
                                                   container->identifier(),
                                                   container->containerClass(), &repaired);
  if (repaired != kKSTSuccess) {
    KSTLog(kLogError, "Error processing restored system container %@: %llu", name,
           static_cast<unsigned long long>(repaired));
  }
}

void _moveFailedPathAside(const KSTFileURL& item, const KSTFileURL& failedDirectory,
                          const std::string& itemName) {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  KSTErrorRef error;
  if (!files.createDirectoryAtURL(failedDirectory, true, 0777, &error)) {
    KSTLog(kLogError, "Failed to create %@: %@", failedDirectory, error);
  }
  const KSTFileURL destination = failedDirectory.appending(itemName, item.isDirectory());
  error = nullptr;
  if (!files.moveItemAtURL(item, destination, &error)) {
    KSTLog(kLogError, "Failed to move %@ to %@: %@", item, destination, error);
  }
}

}  // namespace kestrel
