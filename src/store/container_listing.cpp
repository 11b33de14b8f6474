// Listing: every container of a class for a user, as the cache knows them.
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "store/container_cache.h"

namespace kestrel {

std::optional<std::vector<KSTMetadataRef>> KSTClientConnection::containersForUser(
    std::uint32_t userId, KSTContainerClass withClass, bool transient, std::uint64_t* withError) {
  if (!KSTIsValidContainerClass(withClass)) {
    KSTHandOverCode(
        KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                  "Can't act on an invalid container-userId: %u, class: %ld", userId, withClass),
        withError);
    return std::nullopt;
  }
  using Result = std::optional<std::vector<KSTMetadataRef>>;
  return KST_CATCH_EXCEPTIONS(withError, Result(), [&]() -> Result {
    // Readers of all identifiers exclude creation, replace and deletion, not
    // each other.
    KSTAllIdentifiersLockGuard lock(kKSTLockForReading);
    KSTErrorRef cacheError;
    Result containers = KSTContainerCache::sharedInstance().allContainersForUser(
        userId, withClass, transient, &cacheError);
    if (!containers) KSTHandOverCode(cacheError, withError);
    return containers;
  });
}

}  // namespace kestrel
