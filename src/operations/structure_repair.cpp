// Repairs of one existing container, each under the identifier lock of its
// internal UUID's text, taken for writing for the whole run: putting back the
// default sub-directories of its class (and, for system containers, their
// ACLs), and moving it to a new, random directory name while its identity,
// the internal UUID, stays the same.
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "operations/container_address.h"
#include "store/container_cache.h"
#include "store/file_manager.h"

namespace kestrel {

void KSTClientConnection::recreateDefaultStructureForUser(
    std::uint32_t userId, const std::optional<platform::Uuid>& withUUID,
    const std::optional<std::string>& identifier, KSTContainerClass containerClass,
    std::uint64_t* withError) {
  KSTOnCachedContainer(
      __func__, userId, withUUID, identifier, containerClass, KSTContainerLock::Writing, withError,
      [&](const KSTMetadataRef& container) {
        const KSTFileURL url = container->url();
        KSTErrorRef failure;
        if (!_createSubDirectories(url, userId, containerClass, &failure)) {
          KSTHandOverCode(failure, withError);
          return;
        }
        if (KSTIsSystemClass(containerClass) &&
            !KSTFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(url,
                                                                                     &failure)) {
          KSTHandOverCode(failure, withError);
        }
      });
}

void KSTClientConnection::regenerateDirectoryUUIDForUser(
    std::uint32_t userId, const std::optional<platform::Uuid>& withInternalUUID,
    const std::optional<std::string>& identifier, KSTContainerClass containerClass,
    std::uint64_t* withError) {
  const char* const function = __func__;
  KSTOnCachedContainer(
      function, userId, withInternalUUID, identifier, containerClass, KSTContainerLock::Writing,
      withError, [&](const KSTMetadataRef& container) {
        const KSTFileURL oldURL = container->url();
        const KSTFileURL newURL =
            oldURL.deletingLastPathComponent().appending(platform::Uuid::random().string(), true);

        // A failed move leaves the container, its mapping and the cache as they were.
        KSTErrorRef moveError;
        if (!KSTFileManager::defaultManager().moveItemAtURL(oldURL, newURL, &moveError)) {
          KSTHandOverCode(
              KST_ERROR_IN(function, kKSTErrorRegenerateUUIDFailed, moveError, true,
                           "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL),
              withError);
          return;
        }
        if (!_setSandboxContainerMappingForUser(userId, container->identifier(), containerClass,
                                                newURL)) {
          KSTLogTag(kLogError, function,
                    "Failed to set container mapping in regenerate operation of %@, %llu",
                    container->identifier(), containerClass);
        }
        const bool transient = container->transient();
        KSTErrorRef cacheError;
        if (!KSTContainerCache::sharedInstance().addContainerMetadata(container, userId, newURL,
                                                                      transient, &cacheError)) {
          KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorCacheAddFailed, cacheError, true,
                                       "Failed to add to cache: %@, url: %@, transient: %d",
                                       container, newURL, transient ? 1 : 0),
                          withError);
        }
      });
}

}  // namespace kestrel
