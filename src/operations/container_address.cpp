#include "operations/container_address.h"

#include <string_view>

#include "daemon/error_codes.h"
#include "store/container_cache.h"

namespace kestrel {

KSTErrorRef KSTInvalidContainerAddress(const char* function, std::uint32_t userId,
                                       const std::optional<platform::Uuid>& uuid,
                                       KSTContainerClass containerClass) {
  if (uuid && KSTIsValidContainerClass(containerClass)) return nullptr;
  return KST_ERROR_IN(function, kKSTErrorInvalidObject, nullptr, true,
                      "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld", userId,
                      uuid, containerClass);
}

KSTMetadataRef KSTCachedContainer(const char* function, std::uint32_t userId,
                                  const std::string& uuidString,
                                  const std::optional<std::string>& identifier,
                                  KSTContainerClass containerClass, KSTErrorRef* error) {
  std::optional<std::string_view> name;
  if (identifier) name = *identifier;
  KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
      userId, containerClass, name, uuidString);
  if (!container) {
    KSTSetError(error,
                KST_ERROR_IN(function, kKSTErrorNotFound, nullptr, true,
                             "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                             userId, uuidString, identifier, containerClass));
  }
  return container;
}

}  // namespace kestrel
