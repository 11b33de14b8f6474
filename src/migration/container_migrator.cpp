#include "migration/container_migrator.h"

#include <cerrno>

#include "codesigning/code_signing_mapping.h"
#include "codesigning/whitelist.h"
#include "daemon/log.h"
#include "platform/clock.h"
#include "platform/never_destroyed.h"
#include "platform/services.h"
#include "store/container_cache.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"
#include "store/plist_io.h"

namespace kestrel {
namespace {

// The single mobile user of a device that is not multi-user, whose old
// library and log directories are cleaned up.
constexpr std::uint32_t kOldLayoutUserId = 501;
constexpr gid_t kBundleOwnerGroupId = 33;

bool hostIsMultiUser() {
  const std::optional<platform::UserTypeInfo> info = platform::services().keyBag->userTypeInfo();
  return info && info->deviceMode == platform::DeviceMode::MultiUser;
}

std::string domainOf(const KSTErrorRef& error) {
  return error ? error->domain() : std::string("(null)");
}

long long codeOf(const KSTErrorRef& error) {
  return error ? static_cast<long long>(error->code()) : 0;
}

}  // namespace

KSTContainerMigrator& KSTContainerMigrator::sharedInstance() {
  static platform::NeverDestroyed<KSTContainerMigrator> instance(
      [](void* where) { return new (where) KSTContainerMigrator(); });
  return *instance;
}

const std::string& KSTContainerMigrator::_getCurrentBuildVersion() {
  static const std::string version = [] {
    std::string read = platform::services().deviceInfo->buildVersion();
    return read.empty() ? std::string("Unknown") : read;
  }();
  return version;
}

void KSTContainerMigrator::writeMigrationFileToDiskWithName(std::string_view name) {
  writeMigrationFileToDiskWithName(name,
                                   KSTGlobalConfiguration::sharedInstance().libraryDirectory());
}

void KSTContainerMigrator::writeMigrationFileToDiskWithName(std::string_view name,
                                                            const KSTFileURL& atURL) {
  const std::string& version = _getCurrentBuildVersion();
  PlistDictionary marker;
  marker.insert_or_assign(kKSTMigrationVersionNumberKey, PlistValue(version));
  marker.insert_or_assign(kKSTMigrationTimeKey, PlistValue(platform::currentDateDescription()));
  KSTErrorRef error;
  if (KST_writeToURL(marker, atURL.appending(name, false), kKSTDaemonFileWritingOptions, &error)) {
    KSTLog(kLogNotice, "Migration successfully completed on %@ for %@", version, name);
  } else {
    KSTLog(kLogError, "Failed to write migration file on %@ for %@ : %@", version, name, error);
  }
}

bool KSTContainerMigrator::performSynchronousDaemonStartupMigrationWithError(KSTErrorRef* error) {
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  const KSTFileManager& files = KSTFileManager::defaultManager();

  if (!hostIsMultiUser()) {
    const auto user = layout.getPerUserConfigurationForUserId(kOldLayoutUserId);
    if (const auto oldLibrary = user ? user->oldLibraryDirectoryPath() : std::nullopt) {
      KSTErrorRef removeError;
      if (!files.removeItemAtURL(*oldLibrary, &removeError)) {
        KSTLog(kLogError, "Failed to remove old Library directory: %@", removeError);
      }
    }
    if (const auto oldLogs = user ? user->oldLoggingPath() : std::nullopt) {
      KSTErrorRef listError;
      if (const auto items = files.urlsForItemsInDirectoryAtURL(*oldLogs, &listError)) {
        const KSTFileURL logDirectory = layout.logDirectory();
        for (const KSTFileURL& item : *items) {
          KSTErrorRef moveError;
          if (!files.moveItemAtURL(item, logDirectory.appending(item.lastPathComponent()),
                                   &moveError)) {
            KSTLog(kLogError, "Failed to move to new logging directory from %@ : %@", item,
                   moveError);
          }
        }
        KSTLog(kLogNotice, "Migrated log files on %@", _getCurrentBuildVersion());
      } else if (!listError || !listError->isPOSIXError(ENOENT)) {
        KSTLog(kLogError, "Failed to get items for deletion: %@ : %@", *oldLogs, listError);
      }
      KSTErrorRef removeError;
      if (!files.removeItemAtURL(*oldLogs, &removeError)) {
        KSTLog(kLogError, "Failed to remove old Log directory: %@", removeError);
      }
    }
  }

  const KSTFileURL oldBundles(platform::services().root.resolve(kKSTOldBundleContainerDirectory),
                              true);
  if (files.itemExistsAtURL(oldBundles)) {
    KSTLog(kLogNotice, "Moving bundle containers from user to system location");
    KSTErrorRef moveError;
    if (!files.moveItemAtURL(oldBundles, layout.bundleDirectory(), &moveError)) {
      KSTLog(kLogError,
             "Failed to migrate to new bundle containers location : %@.  This is terrible.",
             moveError);
      KSTSetError(error, std::move(moveError));
      return false;
    }
  }

  KSTErrorRef whitelistError;
  if (!_performWhitelistMigrationWithError(&whitelistError)) {
    KSTLog(kLogError, "Failed to migrate whitelisted bundle containers : %@", whitelistError);
    KSTSetError(error, std::move(whitelistError));
    return false;
  }
  return true;
}

bool KSTContainerMigrator::performDataMigratorMigrationWithError(KSTErrorRef* error) {
  KSTLog(kLogNotice, "Performing Data Migration on %@", _getCurrentBuildVersion());
  KSTErrorRef lastError;
  KSTErrorRef stepError;
  if (!_performInternalACLMigrationWithError(&stepError)) {
    KSTLog(kLogError, "Failed to migrate ACLs on system containers : %@", stepError);
    lastError = std::move(stepError);
  }
  stepError = nullptr;
  if (!_performBundleContainerOwnershipMigrationWithError(&stepError)) {
    KSTLog(kLogError, "Failed to migrate bundle containers to system location : %@", stepError);
    lastError = std::move(stepError);
  }
  // Whatever happened above: the code-signing data does not depend on it.
  KSTCodeSigningMapping::sharedInstance().performAllCodeSigningMigrationAndReconciliation();
  if (lastError) {
    KSTSetError(error, std::move(lastError));
    return false;
  }
  return true;
}

bool KSTContainerMigrator::_performBundleContainerOwnershipMigrationWithError(KSTErrorRef* error) {
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  if (layout.migrationFileExistsWithName(kKSTBundleMigrationMarker)) return true;
  KSTLog(kLogNotice, "Changing ownership of bundle container content.");
  const KSTFileURL bundles = layout.bundleDirectory();
  KSTErrorRef ownerError;
  if (!KSTFileManager::defaultManager().standardizeOwnershipAtURL(
          bundles, kKSTInstallerUserId, kBundleOwnerGroupId, &ownerError)) {
    KSTSetError(error, KST_ERROR(kKSTErrorChangeOwnerFailed, ownerError, false,
                                 "Failed to change owner of %@: %@", bundles, ownerError));
    return false;
  }
  KSTLog(kLogNotice, "Successful bundle migration. Writing marker file.");
  writeMigrationFileToDiskWithName(kKSTBundleMigrationMarker);
  return true;
}

bool KSTContainerMigrator::_performInternalACLMigrationWithError(KSTErrorRef* error) {
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  if (layout.migrationFileExistsWithName(kKSTACLMigrationMarker)) return true;
  const KSTFileManager& files = KSTFileManager::defaultManager();

  KSTErrorRef systemError;
  const auto systemContainers = layout.containerDirectoryURLForUser(
      kKSTSystemContainerUserId, kKSTContainerClassDataSystem, false);
  if (systemContainers && files.itemExistsAtURL(*systemContainers) &&
      !files.standardizeAllSystemContainerACLsAtURL(*systemContainers, &systemError)) {
    KSTLog(kLogError, "Failed to set ACLs on system containers : %@", systemError);
  }
  const auto systemGroups = layout.containerDirectoryURLForUser(
      kKSTSystemContainerUserId, kKSTContainerClassSharedSystemGroup, false);
  KSTErrorRef groupError;
  if (systemGroups && files.itemExistsAtURL(*systemGroups) &&
      !files.standardizeAllSystemContainerACLsAtURL(*systemGroups, &groupError)) {
    KSTLog(kLogError, "Failed to set ACLs on system group containers : %@", groupError);
    KSTSetError(error, std::move(groupError));
    return false;
  }
  if (systemError) {
    KSTSetError(error, std::move(systemError));
    return false;
  }
  KSTLog(kLogNotice, "Successful acl migration. Writing marker file.");
  writeMigrationFileToDiskWithName(kKSTACLMigrationMarker);
  return true;
}

bool KSTContainerMigrator::_performWhitelistMigrationWithError(KSTErrorRef* error) {
  const char* const migration = __func__;
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  const KSTFileManager& files = KSTFileManager::defaultManager();
  const KSTWhitelist& whitelist = KSTWhitelist::sharedWhitelist();

  for (const KSTContainerClass containerClass :
       {kKSTContainerClassDataSystem, kKSTContainerClassSharedSystemGroup}) {
    const auto classDirectory =
        layout.containerDirectoryURLForUser(kKSTSystemContainerUserId, containerClass, false);
    KSTErrorRef listError;
    const auto containers =
        cache.allContainersForUser(kKSTSystemContainerUserId, containerClass, false, &listError);
    if (!containers || !classDirectory) {
      KSTLog(kLogError, "Failed to get list of system containers for migration: (error= %@ : %lld)",
             domainOf(listError), codeOf(listError));
      KSTSetError(error, std::move(listError));
      return false;
    }
    for (const KSTMetadataRef& container : *containers) {
      const std::string& identifier = container->identifier();
      const auto fixedName = whitelist.wellknownContainerForId(identifier, containerClass);
      if (!fixedName) continue;
      const KSTFileURL oldPlace = container->url();
      const KSTFileURL fixedPlace = classDirectory->appending(*fixedName, true);
      if (oldPlace.path() == fixedPlace.path()) continue;
      KSTLog(kLogNotice, "Migrating well-known container %@ from %@ to %@", identifier, oldPlace,
             fixedPlace);
      KSTErrorRef stepError;
      if (!cache.removeContainerForUser(kKSTSystemContainerUserId, containerClass, identifier,
                                        false, &stepError)) {
        KSTLog(kLogError,
               "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
               migration, identifier, domainOf(stepError), codeOf(stepError));
        KSTSetError(error, std::move(stepError));
        return false;
      }
      if (!files.moveItemAtURL(oldPlace, fixedPlace, &stepError)) {
        KSTLog(kLogError,
               "%s: Failed to move system container %@ from %@ to whitelisted location %@: "
               "(error= %@: %lld)",
               migration, identifier, oldPlace, fixedPlace, domainOf(stepError), codeOf(stepError));
        KSTSetError(error, std::move(stepError));
        return false;
      }
      container->setUrl(fixedPlace);
      if (!cache.addContainerMetadata(container, kKSTSystemContainerUserId, fixedPlace, false,
                                      &stepError)) {
        KSTLog(kLogError,
               "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
               migration, identifier, domainOf(stepError), codeOf(stepError));
        KSTSetError(error, std::move(stepError));
        return false;
      }
    }
  }
  return true;
}

}  // namespace kestrel
