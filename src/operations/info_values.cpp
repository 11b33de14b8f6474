// A container's info dictionary, one value at a time, and its whole metadata
// record. Each finds the container in the cache by user, class, identifier
// and internal UUID, and serialises on the identifier lock of that UUID's
// text: a set holds it for writing from the read of the old dictionary to
// the cache update, so two sets of one container never lose each other's key.
#include <optional>
#include <string>

#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "operations/container_address.h"
#include "store/container_cache.h"
#include "store/container_class.h"

namespace kestrel {

void KSTClientConnection::setInfoValue(const std::optional<PlistValue>& value,
                                       const std::optional<std::string>& forKey,
                                       std::uint32_t userId,
                                       const std::optional<platform::Uuid>& uuid,
                                       const std::optional<std::string>& identifier,
                                       KSTContainerClass containerClass, bool useLocking,
                                       std::uint64_t* withError) {
  const char* const function = __func__;
  const auto keyGiven = [&]() -> KSTErrorRef {
    if (forKey) return nullptr;
    return KST_ERROR_IN(function, kKSTErrorInvalidParameter, nullptr, true,
                        "Can't set nil or non-Strand key: %@", forKey);
  };
  KSTOnCachedContainer(function, userId, uuid, identifier, containerClass,
                       useLocking ? KSTContainerLock::Writing : KSTContainerLock::None, withError,
                       keyGiven, [&](const KSTMetadataRef& container) {
                         const std::optional<PlistDictionary> before = container->info();
                         PlistDictionary info = before.value_or(PlistDictionary{});
                         if (value) {
                           info.insert_or_assign(*forKey, *value);
                         } else {
                           info.erase(*forKey);
                         }
                         container->setInfo(std::move(info));
                         KSTErrorRef failure;
                         if (!container->writeMetadataToDiskWithError(&failure)) {
                           // The record keeps agreeing with its file.
                           container->setInfo(before);
                           KSTHandOverCode(failure, withError);
                           return;
                         }

                         const KSTFileURL url = container->url();
                         const bool transient = container->transient();
                         KSTErrorRef cacheError;
                         if (!KSTContainerCache::sharedInstance().addContainerMetadata(
                                 container, userId, url, transient, &cacheError)) {
                           KSTHandOverCode(
                               KST_ERROR_IN(function, kKSTErrorCacheAddFailed, cacheError, true,
                                            "Failed to add to cache: %@, url: %@, transient: %d",
                                            container, url, transient ? 1 : 0),
                               withError);
                         }
                       });
}

std::optional<PlistValue> KSTClientConnection::infoValueForKey(
    const std::optional<std::string>& key, std::uint32_t userId,
    const std::optional<platform::Uuid>& uuid, const std::optional<std::string>& identifier,
    KSTContainerClass containerClass, bool useLocking, std::uint64_t* withError) {
  const char* const function = __func__;
  const auto keyGiven = [&]() -> KSTErrorRef {
    if (key) return nullptr;
    return KST_ERROR_IN(function, kKSTErrorInvalidParameter, nullptr, true,
                        "Can't get nil or non-Strand key: %@", key);
  };
  return KSTOnCachedContainer(
      function, userId, uuid, identifier, containerClass,
      useLocking ? KSTContainerLock::Reading : KSTContainerLock::None, withError, keyGiven,
      [&](const KSTMetadataRef& container) -> std::optional<PlistValue> {
        const std::optional<PlistDictionary> info = container->info();
        if (info) {
          if (const auto found = info->find(*key); found != info->end()) return found->second;
        }
        // An ordinary answer, not a fault: no log line.
        KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorInfoValueNotFound, nullptr, false,
                                     "Didn't find info value for key: %@", key),
                        withError);
        return std::nullopt;
      });
}

KSTMetadataRef KSTClientConnection::metadataForUser(std::uint32_t userId,
                                                    const std::optional<platform::Uuid>& withUUID,
                                                    const std::optional<std::string>& identifier,
                                                    KSTContainerClass containerClass,
                                                    std::uint64_t* withError) {
  return KSTOnCachedContainer(__func__, userId, withUUID, identifier, containerClass,
                              KSTContainerLock::Reading, withError,
                              [](const KSTMetadataRef& container) { return container; });
}

}  // namespace kestrel
