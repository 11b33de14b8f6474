#include "codesigning/group_manager.h"

#include <algorithm>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"

namespace kestrel {
namespace {

struct GroupTypeTraits {
  const char* key;
  std::optional<std::string_view> fallBackKey;
};

GroupTypeTraits traitsOf(KSTGroupType type) {
  if (type == kKSTGroupTypeSystem) {
    return {kKSTSystemGroupsEntitlement, std::string_view(kKSTSystemGroupContainersEntitlement)};
  }
  return {kKSTApplicationGroupsEntitlement, std::nullopt};
}

PlistValue describedList(const std::vector<std::string>& strings) {
  return PlistValue(PlistArray(strings.begin(), strings.end()));
}

// Application group containers live with every valid user whose base
// directory exists; the others are skipped.
void forEachUserWithBaseDirectory(const std::function<void(std::uint32_t userId)>& block) {
  KSTForEachValidUserId([&](std::uint32_t userId) {
    const auto configuration =
        KSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(userId);
    if (configuration && configuration->existsUserBaseDirectory()) block(userId);
  });
}

// Stages one group container on death row without taking locks; 1 on success.
std::uint64_t stageForDeletion(std::uint32_t userId, const KSTMetadata& container) {
  std::uint64_t code = kKSTSuccess;
  KSTClientConnection::sharedClientConnection().stageForDeleteContainersWithUsers(
      {userId}, {container.uuid()}, std::vector<std::optional<std::string>>{container.identifier()},
      {container.containerClass()}, false, &code);
  return code;
}

// Built on behalf of the operation named.
KSTErrorRef invalidObjectError(const char* operation, std::uint32_t userId,
                               const std::optional<std::string>& identifier) {
  return KST_ERROR_IN(operation, kKSTErrorInvalidObject, nullptr, true,
                      "Can't act on an invalid object: userId: %u, ID: %@", userId, identifier);
}

}  // namespace

KSTGroupManager& KSTGroupManager::defaultManager() {
  static KSTGroupManager manager;
  return manager;
}

// ---- Lookups ------------------------------------------------------------------

std::optional<PlistDictionary> KSTGroupManager::groupContainerPathsForUser(
    std::uint32_t userId, KSTClientConnection& clientConnection,
    const std::optional<std::string>& identifier, std::uint64_t* withError) {
  if (!identifier) {
    KSTHandOverCode(invalidObjectError(__func__, userId, identifier), withError);
    return std::nullopt;
  }
  const char* const operation = __func__;
  return KST_CATCH_EXCEPTIONS(withError, std::nullopt, [&]() -> std::optional<PlistDictionary> {
    KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
    KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
    const bool system = userId == kKSTSystemContainerUserId;
    const KSTGroupIdentifiers groups =
        system ? mapping.systemGroupIdentifiersForIdentifier(*identifier)
               : mapping.appGroupIdentifiersForIdentifier(*identifier);
    const KSTContainerClass groupClass =
        system ? kKSTContainerClassSharedSystemGroup : kKSTContainerClassSharedAppGroup;
    clientConnection.setAllowGroupIdLookup(true);

    PlistDictionary paths;
    for (const std::string& group : groups.value_or(std::vector<std::string>{})) {
      std::uint64_t code = kKSTSuccess;
      const KSTMetadataRef container = clientConnection.createOrLookupContainerForUser(
          userId, group, true, groupClass, false, false, &code);
      if (!container) {
        KSTLogTag(kLogError, operation,
                  "Failed to create or lookup group container-userId: %u, ID: %@ : %llu", userId,
                  *identifier, static_cast<unsigned long long>(code));
        continue;
      }
      paths.insert_or_assign(group, container->url().path());
    }
    return paths;
  });
}

std::optional<PlistArray> KSTGroupManager::groupContainerIdentifiersForUser(
    std::uint32_t userId, const std::optional<std::string>& identifier, std::uint64_t* withError) {
  if (!identifier) {
    KSTHandOverCode(invalidObjectError(__func__, userId, identifier), withError);
    return std::nullopt;
  }
  return KST_CATCH_EXCEPTIONS(withError, std::nullopt, [&]() -> std::optional<PlistArray> {
    KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
    const KSTGroupIdentifiers groups =
        KSTCodeSigningMapping::sharedInstance().appGroupIdentifiersForIdentifier(*identifier);
    if (!groups) return PlistArray{};
    return PlistArray(groups->begin(), groups->end());
  });
}

// ---- Dropped references -------------------------------------------------------

void KSTGroupManager::handleChangeFromOldGroupContainerIds(
    const KSTGroupIdentifiers& old, const KSTGroupIdentifiers& toNewGroupContainerIds,
    KSTGroupType ofType, KSTCodeSigningMappingState& inMapping) {
  if (!old && !toNewGroupContainerIds) return;
  if (old == toNewGroupContainerIds) return;
  if (!old) return;  // only new groups: their containers appear when first asked for

  std::vector<std::string> dropped = *old;
  if (toNewGroupContainerIds) {
    std::erase_if(dropped, [&](const std::string& group) {
      return std::find(toNewGroupContainerIds->begin(), toNewGroupContainerIds->end(), group) !=
             toNewGroupContainerIds->end();
    });
  }
  _removeReferenceForGroupIdentifiers(dropped, ofType, inMapping);
}

KSTGroupReferenceCounts KSTGroupManager::_copyReferenceCountSetOfType(
    KSTGroupType type, KSTCodeSigningMappingState& inMapping) {
  const GroupTypeTraits traits = traitsOf(type);
  KSTGroupReferenceCounts counts;
  const char* const operation = __func__;
  inMapping.iterateGroupIdsWithKey(
      traits.key, traits.fallBackKey,
      [&](const std::string& identifier, const KSTGroupIdentifiers& groupIds) {
        if (!groupIds) return;
        KSTLogTag(kLogDebug, operation,
                  "Entitlements for identifier %@ references container IDs: %@", identifier,
                  describedList(*groupIds));
        for (const std::string& group : *groupIds) ++counts[group];
      });
  return counts;
}

void KSTGroupManager::_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& identifiers, KSTGroupType ofType,
    KSTCodeSigningMappingState& inMapping) {
  if (identifiers.empty()) return;
  KSTGroupReferenceCounts counts = _copyReferenceCountSetOfType(ofType, inMapping);
  if (ofType == kKSTGroupTypeSystem) {
    _removeGroupContainersIfNeededforUser(kKSTSystemContainerUserId,
                                          kKSTContainerClassSharedSystemGroup, identifiers, counts);
    return;
  }
  forEachUserWithBaseDirectory([&](std::uint32_t userId) {
    KSTGroupReferenceCounts userCounts = counts;
    _removeGroupContainersIfNeededforUser(userId, kKSTContainerClassSharedAppGroup, identifiers,
                                          userCounts);
  });
}

void KSTGroupManager::_removeGroupContainersIfNeededforUser(
    std::uint32_t userId, KSTContainerClass groupContainerClass,
    const std::vector<std::string>& identifiers, KSTGroupReferenceCounts& referenceCounts) {
  for (const std::string& group : identifiers) {
    auto counted = referenceCounts.find(group);
    const long count = counted == referenceCounts.end() ? 0 : counted->second;
    if (count == 1) {
      // The only reference left is the one going away.
      KSTErrorRef lookupError;
      const KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
          userId, groupContainerClass, group, false, &lookupError);
      if (!container) {
        KSTLog(kLogDebug,
               "Failed to retrieve group container %@ for %u : %@.  May not exist for this user",
               group, userId, lookupError);
      } else {
        KSTLog(kLogNotice,
               "Last reference to group container %@ for %u is going away; removing it.", group,
               userId);
        const std::uint64_t code = stageForDeletion(userId, *container);
        if (code != kKSTSuccess) {
          KSTLog(kLogError, "Failed to destroy group container with identifier %@ for %u: %llu",
                 group, userId, static_cast<unsigned long long>(code));
        }
      }
    } else {
      KSTLog(kLogDebug, "Reference count for user: %u, ID: %@ is %ld", userId, group, count);
    }
    if (counted != referenceCounts.end() && --counted->second <= 0) referenceCounts.erase(counted);
  }
}

// ---- Reconciliation -------------------------------------------------------------

void KSTGroupManager::reconcileGroupContainersOfType(KSTGroupType type,
                                                     KSTCodeSigningMappingState& inMapping) {
  const KSTGroupReferenceCounts counts = _copyReferenceCountSetOfType(type, inMapping);
  if (type == kKSTGroupTypeSystem) {
    _cleanupUnreferencedGroupContainersForUser(kKSTSystemContainerUserId,
                                               kKSTContainerClassSharedSystemGroup, counts);
    return;
  }
  forEachUserWithBaseDirectory([&](std::uint32_t userId) {
    _cleanupUnreferencedGroupContainersForUser(userId, kKSTContainerClassSharedAppGroup, counts);
  });
}

void KSTGroupManager::_cleanupUnreferencedGroupContainersForUser(
    std::uint32_t userId, KSTContainerClass containerClass,
    const KSTGroupReferenceCounts& referenceCounts) {
  KSTErrorRef listError;
  const auto containers = KSTContainerCache::sharedInstance().allContainersForUser(
      userId, containerClass, false, &listError);
  if (!containers) {
    KSTLog(kLogError, "Failed to fetch group container list for %u: %@", userId, listError);
    return;
  }
  for (const KSTMetadataRef& container : *containers) {
    if (referenceCounts.contains(container->identifier())) continue;
    KSTLog(kLogError, "Removing group container with identifier %@ for %u", container->identifier(),
           userId);
    const std::uint64_t code = stageForDeletion(userId, *container);
    if (code != kKSTSuccess) {
      KSTLog(kLogError, "Failed to destroy group container with identifier %@ for %u: %llu",
             container->identifier(), userId, static_cast<unsigned long long>(code));
    }
  }
}

}  // namespace kestrel
