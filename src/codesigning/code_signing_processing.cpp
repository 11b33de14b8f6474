// Processing new code-signing information for one identifier: the one place
// where entitlements take effect. The identifier's entry is rebuilt from the
// information and options, a plug-in is linked to its parent, and what the old
// entitlements held but the new ones no longer name is let go: the system
// container is staged for deletion and the group manager drops the group
// references. Everything that reads the old entitlements runs before the
// store changes, so the group reference counts still include the departing
// reference.
#include <algorithm>

#include "codesigning/code_signing_mapping.h"
#include "codesigning/group_manager.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "store/container_cache.h"

namespace kestrel {
namespace {

constexpr const char* kProcessingTag = "_onQueue_processCodeSigningInfo";

bool booleanOption(const std::optional<PlistDictionary>& options, std::string_view key) {
  if (!options) return false;
  auto it = options->find(key);
  return it != options->end() && it->second.boolean().value_or(false);
}

std::optional<PlistDictionary> entitlementsOf(const std::optional<PlistDictionary>& info) {
  if (!info) return std::nullopt;
  auto it = info->find(kKSTEntitlementsKey);
  if (it == info->end() || !it->second.isDictionary()) return std::nullopt;
  return *it->second.dictionary();
}

std::string describedList(const std::vector<std::string>& list) {
  PlistArray array(list.begin(), list.end());
  return PlistValue(std::move(array)).description();
}

// Stages the identifier's system container for deletion, if there is one.
// A failure is logged only: losing the entitlement still succeeds.
void stageSystemContainerForDeletion(const std::string& identifier) {
  KSTErrorRef lookupError;
  const KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
      kKSTSystemContainerUserId, kKSTContainerClassDataSystem, identifier, false, &lookupError);
  if (!container) {
    KSTLogTag(kLogError, kProcessingTag, "Failed to retrieve system container %@: %@", identifier,
              lookupError);
    return;
  }
  KSTLogTag(kLogError, kProcessingTag,
            "Deleting system container for ID: %@ because it is no longer in the entitlements",
            identifier);
  // The caller holds the lock on all identifiers: no locking here.
  std::uint64_t code = kKSTSuccess;
  KSTClientConnection::sharedClientConnection().stageForDeleteContainersWithUsers(
      {kKSTSystemContainerUserId}, {container->uuid()},
      std::vector<std::optional<std::string>>{identifier}, {container->containerClass()}, false,
      &code);
  if (code != kKSTSuccess) {
    KSTLogTag(kLogError, kProcessingTag,
              "Failed to destroy system container with identifier %@: %llu", identifier,
              static_cast<unsigned long long>(code));
  }
}

}  // namespace

std::uint64_t KSTCodeSigningMappingState::_onQueue_processCodeSigningInfo(
    const std::optional<PlistDictionary>& info, const std::optional<std::string>& forIdentifier,
    const std::optional<PlistDictionary>& withOptions) {
  std::uint64_t code = kKSTSuccess;
  KST_CATCH_EXCEPTIONS(&code, [&] {
    // 1-2.
    std::vector<KSTCodeSigningEntry> stagedValues;
    std::vector<std::string> stagedIdentifiers;
    KSTCodeSigningEntry entry;
    if (!forIdentifier) {
      code = kKSTErrorMissingIdentifier;
      return;
    }
    const std::string& identifier = *forIdentifier;

    // 3. Copied: staging the parent below may change the store's map.
    std::optional<KSTCodeSigningEntry> old;
    if (const KSTCodeSigningEntry* stored = entryForIdentifier(identifier)) old = *stored;

    // 4.
    if (withOptions) {
      auto it = withOptions->find(kKSTDataContainerClassOption);
      if (it != withOptions->end()) {
        entry.setDataContainerClass(it->second.unsignedInteger().value_or(0));
      }
    }

    // 5. Children that have lost their entries are dropped from the list.
    if (old && old->childBundleIdentifiers()) {
      std::vector<std::string> children = *old->childBundleIdentifiers();
      std::erase_if(children,
                    [&](const std::string& child) { return entryForIdentifier(child) == nullptr; });
      entry.setChildBundleIdentifiers(std::move(children));
    }

    // 6. A plug-in joins its parent's list once. A parent without an entry
    // stays without one: an entry without information stages nothing.
    if (withOptions) {
      auto it = withOptions->find(kKSTParentBundleIDOption);
      if (it != withOptions->end() && it->second.isString()) {
        const std::string& parent = *it->second.string();
        const KSTCodeSigningEntry* parentEntry = entryForIdentifier(parent);
        KSTCodeSigningEntry staged = parentEntry ? *parentEntry : KSTCodeSigningEntry();
        std::vector<std::string> children =
            staged.childBundleIdentifiers().value_or(std::vector<std::string>{});
        if (std::find(children.begin(), children.end(), identifier) == children.end()) {
          children.push_back(identifier);
          staged.setChildBundleIdentifiers(children);
          KSTLogTag(kLogDebug, kProcessingTag,
                    "Staging Child Bundles: %@ for parent ID: %@ by appending: %@",
                    describedList(children), parent, identifier);
          stagedValues.push_back(std::move(staged));
          stagedIdentifiers.push_back(parent);
        }
      }
    }

    // 7.
    entry.setRegisteredByCaller(booleanOption(withOptions, kKSTRegisteredByCallerOption));
    entry.setPlaceholder(booleanOption(withOptions, kKSTPlaceholderEntitlementsOption));
    entry.setCodeSigningInfo(info);

    // 8. Unchanged: only the parent's entry may be staged.
    if (!old || !entry.isEqual(*old)) {
      // 9. The queries below still see the old entry.
      const std::optional<PlistDictionary> entitlements = entitlementsOf(info);

      // 10. "NO" and absent both take the system container away.
      if (_onQueue_identifierHasSystemContainer(identifier)) {
        bool keeps = false;
        if (entitlements) {
          auto it = entitlements->find(kKSTSystemContainerEntitlement);
          keeps = it != entitlements->end() && it->second.boolean().value_or(false);
        }
        if (!keeps) stageSystemContainerForDeletion(identifier);
      }

      KSTGroupManager& groups = KSTGroupManager::defaultManager();
      // 11.
      const KSTGroupIdentifiers newAppGroups = _copyApplicationGroupEntitlementForIdentifier(
          identifier, entitlements, kKSTApplicationGroupsEntitlement);
      const KSTGroupIdentifiers oldAppGroups =
          _onQueue_appGroupIdentifiersForIdentifier(identifier);
      if (newAppGroups || oldAppGroups) {
        groups.handleChangeFromOldGroupContainerIds(oldAppGroups, newAppGroups,
                                                    kKSTGroupTypeApplication, *this);
      }

      // 12. No prefix filter on the new list.
      KSTGroupIdentifiers newSystemGroups = _copyApplicationGroupEntitlementForIdentifier(
          identifier, entitlements, kKSTSystemGroupsEntitlement);
      if (!newSystemGroups || newSystemGroups->empty()) {
        newSystemGroups = _copyApplicationGroupEntitlementForIdentifier(
            identifier, entitlements, kKSTSystemGroupContainersEntitlement);
      }
      const KSTGroupIdentifiers oldSystemGroups =
          _onQueue_systemGroupIdentifiersForIdentifier(identifier);
      if (newSystemGroups || oldSystemGroups) {
        groups.handleChangeFromOldGroupContainerIds(oldSystemGroups, newSystemGroups,
                                                    kKSTGroupTypeSystem, *this);
      }

      // 13. Without information the entry goes, whatever the options said.
      if (!info) entry = KSTCodeSigningEntry();
      stagedValues.push_back(std::move(entry));
      stagedIdentifiers.push_back(identifier);
    }

    // 14.
    if (!stagedValues.empty()) {
      if (KSTErrorRef error = _setCodeSigningDictionaryValues(stagedValues, stagedIdentifiers)) {
        KSTHandOverCode(error, &code);
      }
    }
  });
  // 15.
  return code;
}

std::uint64_t KSTCodeSigningMapping::processCodeSigningInfo(
    const std::optional<PlistDictionary>& info, const std::optional<std::string>& forIdentifier,
    const std::optional<PlistDictionary>& withOptions) {
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  return withState(std::uint64_t{0}, [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_processCodeSigningInfo(info, forIdentifier, withOptions);
  });
}

bool KSTCodeSigningMappingState::_onQueue_callerRegisteredInfoIsCurrent(
    const std::string& identifier, const PlistDictionary& info) const {
  // What steps 3 to 8 of the processing would compare, for the options
  // {RegByCaller: YES} alone: no parent, no data container class.
  const KSTCodeSigningEntry* old = entryForIdentifier(identifier);
  if (old == nullptr) return false;
  KSTCodeSigningEntry entry;
  if (old->childBundleIdentifiers()) {
    std::vector<std::string> children = *old->childBundleIdentifiers();
    std::erase_if(children,
                  [&](const std::string& child) { return entryForIdentifier(child) == nullptr; });
    entry.setChildBundleIdentifiers(std::move(children));
  }
  entry.setRegisteredByCaller(true);
  entry.setCodeSigningInfo(info);
  return entry.isEqual(*old);
}

bool KSTCodeSigningMapping::callerRegisteredEntitlementsNeedProcessing(
    const PlistDictionary& entitlements, const std::string& identifier) {
  const PlistDictionary info{{kKSTEntitlementsKey, entitlements}};
  return withState(true, [&](KSTCodeSigningMappingState& state) {
    if (!state._onQueue_identifierHasCallerRegisteredEntitlements(identifier) &&
        state._onQueue_codeSigningInfoExistForIdentifier(identifier)) {
      return false;  // information from elsewhere: not the client's to change
    }
    return !state._onQueue_callerRegisteredInfoIsCurrent(identifier, info);
  });
}

std::uint64_t KSTCodeSigningMapping::processCallerRegisteredEntitlements(
    const PlistDictionary& entitlements, const std::optional<std::string>& forIdentifier) {
  const PlistDictionary info{{kKSTEntitlementsKey, entitlements}};
  // A client that registers its own entitlements has them processed with
  // every request; almost always they are what they were. Processing would
  // then change nothing, and every other request would still have waited for
  // it to take the lock on all identifiers.
  if (forIdentifier && withState(false, [&](KSTCodeSigningMappingState& state) {
        return state._onQueue_callerRegisteredInfoIsCurrent(*forIdentifier, info);
      })) {
    return kKSTSuccess;
  }
  return processCodeSigningInfo(info, forIdentifier,
                                PlistDictionary{{kKSTRegisteredByCallerOption, true}});
}

}  // namespace kestrel
