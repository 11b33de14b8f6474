// Wiping a data container's content: the container is replaced by a fresh,
// empty one of the same identity that keeps its path and UUID, and its old
// content goes to death row with the replace's staging directory.
#include <algorithm>

#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "store/container_class.h"

namespace kestrel {

void KSTClientConnection::deleteDataContainerContentForUser(
    std::uint32_t userId, const std::optional<std::string>& identifier,
    KSTContainerClass containerClass, std::uint64_t* withError) {
  if (!identifier) {
    KSTLog(kLogError, "Can't wipe container with nil identifier: %@, userId: %u", nullptr, userId);
    KSTSetCode(withError, kKSTErrorMissingIdentifier);
    return;
  }
  // The per-user classes: data containers and app groups, never a system class.
  if (!KSTIsPerUserClass(containerClass)) {
    KSTLog(kLogError,
           "Can't wipe container non-data container of type: %llu, identifier: %@, userId: %u",
           containerClass, *identifier, userId);
    KSTSetCode(withError, kKSTErrorInvalidObject);
    return;
  }
  // Without other-id lookup, only the plug-in containers named by the
  // client's wipe entitlement.
  if (!allowOtherIdLookup_) {
    if (containerClass != kKSTContainerClassDataVantlerPlugin) {
      KSTLog(kLogError, "Can't wipe container with of type: %llu, identifier: %@, userId: %u",
             containerClass, *identifier, userId);
      KSTSetCode(withError, kKSTErrorInvalidObject);
      return;
    }
    const std::vector<std::string> none;
    const std::vector<std::string>& entitled = entitledWipeIdentifiers_.value_or(none);
    if (std::find(entitled.begin(), entitled.end(), *identifier) == entitled.end()) {
      KSTLog(kLogError, "Not entitled to wipe container with identifier: %@", *identifier);
      KSTSetCode(withError, kKSTErrorNotEntitled);
      return;
    }
  }

  std::uint64_t code = kKSTSuccess;
  const KSTMetadataRef old =
      createOrLookupContainerForUser(userId, identifier, false, containerClass, false, true, &code);
  if (!old) {
    KSTLog(kLogError, "Failed to lookup existing container to wipe-identifier: %@", *identifier);
    KSTSetCode(withError, code);
    return;
  }
  // The empty container: the transient one of the same identity, made afresh.
  const KSTMetadataRef fresh =
      createOrLookupContainerForUser(userId, identifier, true, containerClass, true, true, &code);
  if (!fresh) {
    KSTLog(kLogError, "Failed to create transient container for wipe-identifier: %@", *identifier);
    KSTSetCode(withError, code);
    return;
  }
  replaceContainer(old->uuid(), fresh->uuid(), userId, userId, identifier, identifier,
                   containerClass, containerClass, true, true, &code);
  if (code != kKSTSuccess) {
    KSTLog(kLogError, "Failed replace operation during delete all content");
  }
  KSTSetCode(withError, code);
}

}  // namespace kestrel
