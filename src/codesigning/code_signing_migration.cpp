// Older releases kept code-signing data in three other places: each data
// container's info named its application groups, one file held every
// identifier's entitlements, and the installer cached each bundle's
// information in the bundle container's info. Command 24 moves all of it
// into the store, clears the old copies and then removes the application
// group containers that nothing names any more.
#include <array>
#include <utility>

#include "codesigning/code_signing_mapping.h"
#include "codesigning/group_manager.h"
#include "daemon/client_connection.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "migration/container_migrator.h"
#include "store/container_cache.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/plist_io.h"

namespace kestrel {
namespace {

constexpr std::uint32_t kOldLayoutUserId = 501;

// A container whose old copy is to be cleared once the store has what it held.
struct OldCopy {
  std::uint32_t userId;
  KSTMetadataRef container;
};

const PlistValue* infoValue(const KSTMetadataRef& container, std::string_view key,
                            std::optional<PlistDictionary>& info) {
  info = container->info();
  if (!info) return nullptr;
  auto it = info->find(key);
  return it == info->end() ? nullptr : &it->second;
}

// Removes the key from each container's info; failures go to onFailure.
template <typename OnFailure>
void clearOldCopies(const std::vector<OldCopy>& copies, const char* key, OnFailure&& onFailure) {
  KSTClientConnection& shared = KSTClientConnection::sharedClientConnection();
  for (const OldCopy& copy : copies) {
    std::uint64_t code = kKSTSuccess;
    shared.setInfoValue(std::nullopt, std::string(key), copy.userId, copy.container->uuid(),
                        copy.container->identifier(), copy.container->containerClass(), false,
                        &code);
    if (code != kKSTSuccess) onFailure(*copy.container, code);
  }
}

}  // namespace

void KSTCodeSigningMappingState::_migrateAppGroupIdsFromDataContainersToFile() {
  if (KSTGlobalConfiguration::sharedInstance().migrationFileExistsWithName(
          kKSTGroupIdMigrationMarker)) {
    return;
  }
  KSTLog(kLogNotice, "Performing group ID migration");
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  bool stored = false;
  std::vector<OldCopy> toClear;
  for (const KSTContainerClass containerClass :
       {kKSTContainerClassDataApplication, kKSTContainerClassDataVantlerPlugin,
        kKSTContainerClassDataVPNPlugin}) {
    KSTErrorRef listError;
    const auto containers =
        cache.allContainersForUser(kOldLayoutUserId, containerClass, false, &listError);
    if (!containers) {
      KSTLog(kLogError, "Failed to fetch list of containers for userId: 501, class %ld : %@",
             static_cast<long>(containerClass), listError);
      return;
    }
    for (const KSTMetadataRef& container : *containers) {
      std::optional<PlistDictionary> info;
      const PlistValue* groups = infoValue(container, kKSTGroupContainerIDsKey, info);
      if (groups == nullptr) continue;
      const std::string& identifier = container->identifier();
      KSTLog(kLogDebug,
             "Data container for userId: 501, identifier %@ references container IDs: %@",
             identifier, *groups);
      if (entryForIdentifier(identifier) == nullptr) {
        KSTLog(kLogNotice, "Migrating app group entitlements for %@", identifier);
        PlistDictionary entitlements;
        entitlements.insert_or_assign(kKSTApplicationGroupsEntitlement, *groups);
        PlistDictionary codeSigningInfo;
        codeSigningInfo.insert_or_assign(kKSTEntitlementsKey, PlistValue(std::move(entitlements)));
        KSTCodeSigningEntry entry(std::move(codeSigningInfo), container->containerClass());
        entry.setInvalid(true);
        codeSigningMappingDict_.insert_or_assign(identifier, std::move(entry));
        stored = true;
      } else {
        KSTLog(kLogNotice,
               "Deleting app group entitlements for %@ because we already have them in mapping",
               identifier);
      }
      toClear.push_back({kOldLayoutUserId, container});
    }
  }
  if (stored) {
    if (KSTErrorRef error = _writeCodeSigningMappingToDisk()) {
      KSTLog(kLogError,
             "Failed to write code signing mapping to disk following group id migration: %@",
             error);
      return;
    }
  }
  clearOldCopies(
      toClear, kKSTGroupContainerIDsKey, [](const KSTMetadata& container, std::uint64_t code) {
        KSTLogTag(kLogError, "_migrateAppGroupIdsFromDataContainersToFile",
                  "Failed to clear group id metadata for %@ at %@ : %llu", container.identifier(),
                  container.url(), static_cast<unsigned long long>(code));
      });
  KSTContainerMigrator::sharedInstance().writeMigrationFileToDiskWithName(
      kKSTGroupIdMigrationMarker);
  KSTLog(kLogNotice, "Group ID migration completed");
}

void KSTCodeSigningMappingState::_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  const KSTFileURL legacy = KSTGlobalConfiguration::sharedInstance().libraryDirectory().appending(
      kKSTLegacyEntitlementsFileName, false);
  if (files.itemDoesNotExistAtURL(legacy)) return;
  KSTLog(kLogNotice, "Performing legacy entitlement migration");
  KSTErrorRef readError;
  std::optional<PlistDictionary> contents = KST_dictionaryWithContentsOfURL(
      legacy, kKSTPropertyListMutableContainersAndLeaves, &readError);
  if (!contents) {
    KSTLog(kLogError, "Entitlement File exists at %@, but we unexpectedly cant read it", legacy);
    return;
  }
  const auto takeOut = [&](const char* key) {
    PlistDictionary taken;
    if (auto it = contents->find(key); it != contents->end()) {
      if (const PlistDictionary* dictionary = it->second.dictionary()) taken = *dictionary;
      contents->erase(it);
    }
    return taken;
  };
  const PlistDictionary children = takeOut(kKSTLegacyChildPluginBundleIDsKey);
  const PlistDictionary registeredByCaller = takeOut(kKSTLegacyEntitlementsRegisteredByCallerKey);
  const PlistDictionary placeholders = takeOut(kKSTLegacyPlaceholderEntitlementsKey);

  bool stored = false;
  for (const auto& [identifier, entitlements] : *contents) {
    const KSTCodeSigningEntry* existing = entryForIdentifier(identifier);
    if (existing != nullptr && !existing->invalid()) {
      KSTLog(kLogNotice,
             "Already have code signing info for %@.  No need to migrate legacy entitlements.",
             identifier);
      continue;
    }
    KSTLog(kLogNotice, "Migrating legacy entitlements for %@", identifier);
    PlistDictionary codeSigningInfo;
    codeSigningInfo.insert_or_assign(kKSTEntitlementsKey, entitlements);
    KSTCodeSigningEntry entry(std::move(codeSigningInfo), kKSTContainerClassUndefined);
    if (auto it = children.find(identifier); it != children.end()) {
      if (const PlistArray* array = it->second.array()) {
        std::vector<std::string> childIdentifiers;
        for (const PlistValue& child : *array) {
          if (const std::string* text = child.string()) childIdentifiers.push_back(*text);
        }
        entry.setChildBundleIdentifiers(std::move(childIdentifiers));
      }
    }
    entry.setPlaceholder(placeholders.contains(identifier));
    auto byCaller = registeredByCaller.find(identifier);
    if (byCaller != registeredByCaller.end() && byCaller->second.boolean().value_or(false)) {
      entry.setRegisteredByCaller(true);
    } else {
      entry.setInvalid(true);
    }
    codeSigningMappingDict_.insert_or_assign(identifier, std::move(entry));
    stored = true;
  }
  if (stored) {
    if (KSTErrorRef error = _writeCodeSigningMappingToDisk()) {
      KSTLog(kLogError,
             "Failed to write code signing mapping to disk following legacy migration: %@", error);
      return;
    }
  }
  KSTErrorRef removeError;
  if (!files.removeItemAtURL(legacy, &removeError)) {
    KSTLog(kLogError, "Failed to remove legacy file at %@: %@", legacy, removeError);
  }
  KSTLog(kLogNotice, "Legacy entitlement migration completed");
}

void KSTCodeSigningMappingState::_migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
  if (KSTGlobalConfiguration::sharedInstance().migrationFileExistsWithName(
          kKSTCodeSigningMigrationMarker)) {
    return;
  }
  KSTLog(kLogNotice, "Performing code signing migration");
  // Bundle class -> the class of its data container.
  static constexpr std::array<std::pair<KSTContainerClass, KSTContainerClass>, 4> kBundleClasses{{
      {kKSTContainerClassBundleApplication, kKSTContainerClassDataApplication},
      {kKSTContainerClassBundleVantlerPlugin, kKSTContainerClassDataVantlerPlugin},
      {kKSTContainerClassBundleVPNPlugin, kKSTContainerClassDataVPNPlugin},
      {kKSTContainerClassBundleFramework, kKSTContainerClassUndefined},
  }};
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  bool stored = false;
  std::vector<OldCopy> toClear;
  for (const auto& [bundleClass, dataClass] : kBundleClasses) {
    KSTErrorRef listError;
    const auto containers =
        cache.allContainersForUser(kKSTInstallerUserId, bundleClass, false, &listError);
    if (!containers) {
      KSTLog(kLogError, "Failed to fetch list of containers for class %llu : %@",
             static_cast<unsigned long long>(bundleClass), listError);
      continue;
    }
    for (const KSTMetadataRef& container : *containers) {
      std::optional<PlistDictionary> info;
      const PlistValue* cachedValue = infoValue(container, kKSTCachedCodeSigningInfoKey, info);
      const PlistDictionary* cached = cachedValue != nullptr ? cachedValue->dictionary() : nullptr;
      if (cached == nullptr) continue;
      const std::string& identifier = container->identifier();
      const KSTCodeSigningEntry* existing = entryForIdentifier(identifier);
      if (existing != nullptr && !existing->invalid()) {
        KSTLog(kLogNotice,
               "Deleting cached code signing info for %@ because we already have it in mapping",
               identifier);
      } else {
        KSTLog(kLogNotice, "Migrating code signing info for %@", identifier);
        PlistDictionary codeSigningInfo = *cached;
        if (auto it = codeSigningInfo.find("Entitlements"); it != codeSigningInfo.end()) {
          PlistValue entitlements = it->second;
          codeSigningInfo.insert_or_assign(kKSTEntitlementsKey, std::move(entitlements));
        } else {
          codeSigningInfo.erase(kKSTEntitlementsKey);
        }
        codeSigningMappingDict_.insert_or_assign(
            identifier, KSTCodeSigningEntry(std::move(codeSigningInfo), dataClass));
        stored = true;
      }
      toClear.push_back({kKSTInstallerUserId, container});
    }
  }
  if (stored) {
    if (KSTErrorRef error = _writeCodeSigningMappingToDisk()) {
      KSTLog(kLogError,
             "Failed to write code signing mapping to disk following code signing migration: %@",
             error);
      return;
    }
  }
  clearOldCopies(
      toClear, kKSTCachedCodeSigningInfoKey, [](const KSTMetadata& container, std::uint64_t code) {
        KSTLogTag(kLogError, "_migrateCachedCodeSigningInfoFromBundleContainersToMapping",
                  "Error setting info value for identifier: %@, Class: %llu: %llu",
                  container.identifier(),
                  static_cast<unsigned long long>(container.containerClass()),
                  static_cast<unsigned long long>(code));
      });
  KSTContainerMigrator::sharedInstance().writeMigrationFileToDiskWithName(
      kKSTCodeSigningMigrationMarker);
  KSTLog(kLogNotice, "Code Signing migration completed");
}

void KSTCodeSigningMapping::performAllCodeSigningMigrationAndReconciliation() {
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  withState(false, [](KSTCodeSigningMappingState& state) {
    std::uint64_t code = kKSTSuccess;
    KST_CATCH_EXCEPTIONS(&code, [&] {
      state._migrateAppGroupIdsFromDataContainersToFile();
      state._migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
      state._migrateCachedCodeSigningInfoFromBundleContainersToMapping();
      KSTGroupManager::defaultManager().reconcileGroupContainersOfType(kKSTGroupTypeApplication,
                                                                       state);
    });
    return true;
  });
}

}  // namespace kestrel
