// Taking whole containers out of use. Nothing here destroys anything: a
// container is renamed into the death-row directory under its own directory
// name, and the death-row sweep removes it later. What pointed at it goes at
// once: its sandbox mapping, its cache entry and, for a bundle, the
// code-signing entries of its identifier and of that identifier's children.
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "platform/crash_point.h"
#include "store/container_cache.h"
#include "store/container_identifier.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

// The batch itself, under whatever lock the caller took. Entries that are
// malformed, or name no cached container, are skipped; a container that can
// be neither moved nor removed is skipped too and stays mapped and cached.
// Only a failed cache removal ends the batch (error 46): the container is
// already gone from disk then, and the cache no longer matches it.
//
// Kept apart from the member so that its log lines carry the operation's name.
namespace batch {

bool stageForDeleteContainersWithUsers(KSTClientConnection& client,
                                       const std::vector<std::uint32_t>& users,
                                       const std::vector<std::optional<platform::Uuid>>& UUIDs,
                                       const std::vector<std::optional<std::string>>& identifiers,
                                       const std::vector<std::optional<KSTContainerClass>>& classes,
                                       KSTErrorRef* error) {
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  const KSTFileManager& fileManager = KSTFileManager::defaultManager();

  for (std::size_t i = 0; i < UUIDs.size(); ++i) {
    const std::optional<platform::Uuid>& uuid = UUIDs[i];
    const std::optional<std::string>& identifier = identifiers[i];
    const std::uint32_t userId = users[i];
    const std::optional<KSTContainerClass>& classNumber = classes[i];

    // Bad entries are reported in the log only; the rest of the batch goes on.
    if (!classNumber) {
      KST_ERROR(kKSTErrorInvalidObject, nullptr, true, "Can't act on an invalid object: class: %@",
                classNumber);
      continue;
    }
    const KSTContainerClass containerClass = *classNumber;
    if (!uuid || !identifier || !KSTIsValidContainerClass(containerClass)) {
      KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                "Can't act on an invalid object: userId: %u, UUID: %@, ID: %@, Class: %ld", userId,
                uuid, KSTIdentifierForLog(identifier), containerClass);
      continue;
    }

    // Already gone (or never there): nothing to do, and nothing worth a line.
    const KSTMetadataRef container =
        cache.containerForUser(userId, containerClass, *identifier, uuid->string());
    if (!container) continue;

    const KSTFileURL containerURL = container->url();
    const KSTFileURL destination =
        KSTGlobalConfiguration::sharedInstance().deathrowDirectory().appending(
            containerURL.lastPathComponent(), true);

    if (KSTIsBundleClass(containerClass)) {
      KSTCodeSigningMapping::sharedInstance()
          .removeCodeSigningDictionariesForIdentifierAndItsChildren(*identifier);
    }

    KSTErrorRef moveError;
    if (!fileManager.moveItemAtURL(containerURL, destination, &moveError)) {
      KSTLog(kLogDebug, "Couldn't stage for deletion from %@ to %@: %@", containerURL, destination,
             moveError);
      KSTErrorRef removeError;
      if (!fileManager.removeItemAtURL(containerURL, &removeError)) {
        KST_ERROR(kKSTErrorDeleteFailed, removeError, true, "Failed to delete container at %@: %@",
                  containerURL, removeError);
        continue;
      }
    }

    KST_CRASH_POINT("delete.moved");
    if (!client._setSandboxContainerMappingForUser(userId, *identifier, containerClass,
                                                   std::nullopt)) {
      KSTLog(kLogError, "Failed to remove container mapping in delete operation of %@, %llu",
             *identifier, containerClass);
    }

    const bool transient = container->transient();
    KSTErrorRef cacheError;
    if (!cache.removeContainerForUser(userId, containerClass, container->identifier(), transient,
                                      &cacheError)) {
      KSTSetError(error, KST_ERROR(kKSTErrorCacheRemoveFailed, cacheError, true,
                                   "Failed to remove from cache id: %@, class: %ld, transient: %d",
                                   container->identifier(), containerClass, transient ? 1 : 0));
      return false;
    }
    KST_CRASH_POINT("delete.uncached");
  }
  return true;
}

}  // namespace batch

}  // namespace

void KSTClientConnection::stageForDeleteContainersWithUsers(
    const std::vector<std::uint32_t>& users,
    const std::vector<std::optional<platform::Uuid>>& UUIDs,
    const std::optional<std::vector<std::optional<std::string>>>& identifiers,
    const std::vector<std::optional<KSTContainerClass>>& classes, bool useLocking,
    std::uint64_t* withError) {
  const std::size_t identifierCount = identifiers ? identifiers->size() : 0;
  if (UUIDs.size() != classes.size() || UUIDs.size() != identifierCount) {
    KSTHandOverCode(
        KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                  "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID "
                  "count: %ld",
                  UUIDs.size(), classes.size(), identifierCount),
        withError);
    return;
  }
  // Every entry needs its user; surplus users are ignored.
  if (users.size() < UUIDs.size()) {
    KSTHandOverCode(
        KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                  "Can't act on an invalid input: UUIDString count: %ld, user count: %ld",
                  UUIDs.size(), users.size()),
        withError);
    return;
  }

  KST_CATCH_EXCEPTIONS(withError, [&] {
    std::optional<KSTAllIdentifiersLockGuard> lock;
    if (useLocking) lock.emplace(kKSTLockForWriting);
    static const std::vector<std::optional<std::string>> kNoIdentifiers;
    KSTErrorRef failure;
    if (!batch::stageForDeleteContainersWithUsers(
            *this, users, UUIDs, identifiers ? *identifiers : kNoIdentifiers, classes, &failure)) {
      KSTHandOverCode(failure, withError);
    }
  });
}

void KSTClientConnection::deleteContainerForUser(std::uint32_t userId,
                                                 const std::optional<std::string>& withIdentifier,
                                                 KSTContainerClass containerClass, bool transient,
                                                 std::uint64_t* withError) {
  // The lookup and the staging each take the lock on all identifiers for
  // themselves; nothing is held in between.
  std::uint64_t code = kKSTSuccess;
  const KSTMetadataRef container = createOrLookupContainerForUser(
      userId, withIdentifier, false, containerClass, transient, true, &code);
  if (!container) {
    KSTLog(kLogError,
           "Failed to lookup existing container to delete-identifier: %@, class: %ld, "
           "transient: %d",
           KSTIdentifierForLog(withIdentifier), containerClass, transient ? 1 : 0);
    if (code == kKSTSuccess) code = kKSTErrorNotFound;
  } else {
    KST_CATCH_EXCEPTIONS(&code, [&] {
      stageForDeleteContainersWithUsers(
          {container->uid()}, {container->uuid()},
          std::vector<std::optional<std::string>>{container->identifier()},
          {container->containerClass()}, true, &code);
    });
  }
  KSTSetCode(withError, code);
}

}  // namespace kestrel
