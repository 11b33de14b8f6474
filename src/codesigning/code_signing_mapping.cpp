#include "codesigning/code_signing_mapping.h"

#include <algorithm>
#include <cerrno>

#include "daemon/locks.h"
#include "daemon/log.h"
#include "platform/never_destroyed.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "store/plist_io.h"

namespace kestrel {
namespace {

constexpr std::uint32_t kBundleOwnerUserId = 33;

std::optional<PlistDictionary> entitlementsOf(const std::optional<PlistDictionary>& info) {
  if (!info) return std::nullopt;
  auto it = info->find(kKSTEntitlementsKey);
  if (it == info->end() || !it->second.isDictionary()) return std::nullopt;
  return *it->second.dictionary();
}

bool hasBundleContainer(std::string_view identifier, KSTContainerClass contentClass) {
  KSTErrorRef error;
  return KSTContainerCache::sharedInstance().containerForUser(kBundleOwnerUserId, contentClass,
                                                              identifier, false, &error) != nullptr;
}

}  // namespace

// ---- Load and save ----------------------------------------------------------

std::unique_ptr<KSTCodeSigningMappingState>
KSTCodeSigningMappingState::_readCodeSigningMappingFromDisk(KSTFileURL url) {
  std::unique_ptr<KSTCodeSigningMappingState> state(new KSTCodeSigningMappingState(std::move(url)));
  KSTErrorRef error;
  auto contents = KST_dictionaryWithContentsOfURL(
      state->url_, kKSTPropertyListMutableContainersAndLeaves, &error);
  if (!contents) {
    if (error && error->isPOSIXError(ENOENT)) {
      KSTLog(kLogNotice, "No code signing info file found.  We will create one now");
      return state;
    }
    KSTLog(kLogError, "Failed to read code signing mapping file at %@ : %@", state->url_, error);
    return nullptr;
  }
  for (const auto& [identifier, serialized] : *contents) {
    if (!serialized.isDictionary()) continue;  // a stray value is dropped
    state->codeSigningMappingDict_.emplace(
        identifier, KSTCodeSigningEntry::initWithSerializedDictionary(*serialized.dictionary()));
  }
  return state;
}

KSTErrorRef KSTCodeSigningMappingState::_writeCodeSigningMappingToDisk() const {
  PlistDictionary serialized;
  for (const auto& [identifier, entry] : codeSigningMappingDict_) {
    serialized.emplace(identifier, entry.serialize());
  }
  KSTErrorRef writeError;
  if (KST_writeToURL(serialized, url_, kKSTDaemonFileWritingOptions, &writeError)) return nullptr;
  return KST_ERROR(kKSTErrorMappingWriteFailed, writeError, true,
                   "Failed to write entitlement mapping file at %@ : %@", url_,
                   PlistValue(serialized));
}

KSTErrorRef KSTCodeSigningMappingState::_setCodeSigningDictionaryValues(
    const std::vector<KSTCodeSigningEntry>& values,
    const std::vector<std::string>& forIdentifiers) {
  if (values.size() != forIdentifiers.size()) {
    return KST_ERROR(kKSTErrorMappingInvalidInput, nullptr, true,
                     "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                     static_cast<long>(values.size()), static_cast<long>(forIdentifiers.size()));
  }
  bool changed = false;
  for (std::size_t i = 0; i < values.size(); ++i) {
    const std::string& identifier = forIdentifiers[i];
    const KSTCodeSigningEntry* newValue = values[i].codeSigningInfo() ? &values[i] : nullptr;
    auto old = codeSigningMappingDict_.find(identifier);
    const KSTCodeSigningEntry* oldValue =
        old == codeSigningMappingDict_.end() ? nullptr : &old->second;
    if (oldValue == nullptr && newValue == nullptr) continue;
    if (oldValue != nullptr && newValue != nullptr && oldValue->isEqual(*newValue)) continue;
    if (newValue != nullptr) {
      codeSigningMappingDict_.insert_or_assign(identifier, *newValue);
    } else {
      codeSigningMappingDict_.erase(old);
    }
    KSTLog(kLogDebug, "Staging Code Signing Mapping for ID: %@ : %@", identifier,
           newValue != nullptr ? newValue->description() : std::string("(null)"));
    changed = true;
  }
  if (!changed) return nullptr;
  if (KSTErrorRef error = _writeCodeSigningMappingToDisk()) {
    KSTLog(kLogError, "Error writing code signing mappings to disk after set : %@", error);
    return error;
  }
  KSTLog(kLogDebug, "Wrote code signing mappings to disk after set");
  return nullptr;
}

// ---- Group entitlements -----------------------------------------------------

KSTGroupIdentifiers KSTCodeSigningMappingState::_copyApplicationGroupEntitlementForIdentifier(
    std::string_view identifier, const std::optional<PlistDictionary>& entitlements,
    std::string_view groupKey) {
  if (!entitlements) return std::nullopt;
  auto it = entitlements->find(groupKey);
  if (it == entitlements->end()) return std::nullopt;
  const PlistValue& value = it->second;
  std::vector<std::string> groups;
  auto addOnce = [&](const std::string& group) {
    if (std::find(groups.begin(), groups.end(), group) == groups.end()) groups.push_back(group);
  };
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& element : *array) {
      if (!element.isString()) {
        KSTLog(kLogError, "Entitlement %@ for %@ contains non-string values; ignoring.", groupKey,
               identifier);
        return std::nullopt;
      }
      addOnce(*element.string());
    }
    return groups;
  }
  if (const std::string* single = value.string()) return std::vector<std::string>{*single};
  KSTLog(kLogError, "Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey,
         identifier);
  return std::nullopt;
}

void KSTCodeSigningMappingState::iterateGroupIdsWithKey(std::string_view key,
                                                        std::optional<std::string_view> fallBackKey,
                                                        const KSTGroupIdsBlock& block) {
  for (const auto& [identifier, entry] : codeSigningMappingDict_) {
    const auto entitlements = entitlementsOf(entry.codeSigningInfo());
    auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, key);
    if (fallBackKey && (!groups || groups->empty())) {
      groups =
          _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, *fallBackKey);
    }
    block(identifier, groups);
  }
}

// ---- Queries ----------------------------------------------------------------

const KSTCodeSigningEntry* KSTCodeSigningMappingState::entryForIdentifier(
    std::string_view identifier) const {
  auto it = codeSigningMappingDict_.find(identifier);
  return it == codeSigningMappingDict_.end() ? nullptr : &it->second;
}

std::optional<PlistDictionary> KSTCodeSigningMappingState::_onQueue_codeSigningInfoForIdentifier(
    std::string_view identifier, bool externalRequest) {
  if (const KSTCodeSigningEntry* entry = entryForIdentifier(identifier)) {
    if (externalRequest && (entry->placeholder() || entry->invalid())) return std::nullopt;
    return entry->codeSigningInfo();
  }

  // No entry yet: the bundle container may still hold what the installer cached.
  KSTErrorRef lookupError;
  auto bundle = KSTContainerCache::sharedInstance().containerForUser(
      kBundleOwnerUserId, kKSTContainerClassBundleApplication, identifier, false, &lookupError);
  if (!bundle) return std::nullopt;
  const auto bundleInfo = bundle->info();
  if (!bundleInfo) return std::nullopt;
  auto cached = bundleInfo->find(kKSTCachedCodeSigningInfoKey);
  if (cached == bundleInfo->end() || !cached->second.isDictionary()) return std::nullopt;

  KSTLog(kLogNotice, "Migrating code signing info from bundle container upon request for %@",
         identifier);
  PlistDictionary info = *cached->second.dictionary();
  if (auto entitlements = info.find("Entitlements"); entitlements != info.end()) {
    info.insert_or_assign(kKSTEntitlementsKey, entitlements->second);
  } else {
    info.erase(kKSTEntitlementsKey);
  }
  auto [stored, inserted] = codeSigningMappingDict_.insert_or_assign(
      bundle->identifier(), KSTCodeSigningEntry(info, kKSTContainerClassDataApplication));
  if (KSTErrorRef error = _writeCodeSigningMappingToDisk()) {
    KSTLog(kLogError,
           "Failed to write code signing mapping to disk during current identifier migration of "
           "%@: %@",
           identifier, error);
  }
  return stored->second.codeSigningInfo();
}

std::optional<PlistDictionary> KSTCodeSigningMappingState::_onQueue_entitlementsForIdentifier(
    std::string_view identifier) {
  return entitlementsOf(_onQueue_codeSigningInfoForIdentifier(identifier, false));
}

bool KSTCodeSigningMappingState::_onQueue_codeSigningInfoExistForIdentifier(
    std::string_view identifier) {
  return _onQueue_codeSigningInfoForIdentifier(identifier, false).has_value();
}

bool KSTCodeSigningMappingState::_onQueue_identifierHasCallerRegisteredEntitlements(
    std::string_view identifier) const {
  const KSTCodeSigningEntry* entry = entryForIdentifier(identifier);
  return entry != nullptr && entry->registeredByCaller();
}

bool KSTCodeSigningMappingState::_onQueue_identifierHasSystemContainer(
    std::string_view identifier) {
  const auto entitlements = _onQueue_entitlementsForIdentifier(identifier);
  if (!entitlements) return false;
  auto it = entitlements->find(kKSTSystemContainerEntitlement);
  return it != entitlements->end() && it->second.boolean().value_or(false);
}

KSTContainerClass KSTCodeSigningMappingState::_onQueue_dataContainerTypeForIdentifier(
    std::string_view identifier) const {
  const KSTCodeSigningEntry* entry = entryForIdentifier(identifier);
  return entry != nullptr ? entry->dataContainerClass() : kKSTContainerClassUndefined;
}

KSTGroupIdentifiers KSTCodeSigningMappingState::_onQueue_appGroupIdentifiersForIdentifier(
    std::string_view identifier) {
  return _copyApplicationGroupEntitlementForIdentifier(
      identifier, _onQueue_entitlementsForIdentifier(identifier), kKSTApplicationGroupsEntitlement);
}

KSTGroupIdentifiers KSTCodeSigningMappingState::_onQueue_systemGroupIdentifiersForIdentifier(
    std::string_view identifier) {
  const auto entitlements = _onQueue_entitlementsForIdentifier(identifier);
  auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                              kKSTSystemGroupsEntitlement);
  if (!groups || groups->empty()) {
    groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                           kKSTSystemGroupContainersEntitlement);
  }
  if (!groups) return std::nullopt;
  const char* const operation = __func__;
  std::erase_if(*groups, [operation](const std::string& group) {
    if (group.starts_with(kKSTSystemGroupPrefix)) return false;
    KSTLogTag(kLogError, operation, "System group ID %@ does not have proper prefix, ignoring.",
              group);
    return true;
  });
  return groups;
}

// ---- Removal and invalidation ----------------------------------------------

KSTErrorRef
KSTCodeSigningMappingState::_onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(
    std::string_view identifier) {
  auto it = codeSigningMappingDict_.find(identifier);
  if (it != codeSigningMappingDict_.end()) {
    KSTLog(kLogDebug, "Invalidating code signing info for %@", identifier);
    it->second.setInvalid(true);
    const auto children = it->second.childBundleIdentifiers().value_or(std::vector<std::string>{});
    for (const std::string& child : children) {
      auto childEntry = codeSigningMappingDict_.find(child);
      if (childEntry == codeSigningMappingDict_.end()) continue;
      KSTLog(kLogDebug, "Invalidating code signing info for %@ child: %@", identifier, child);
      childEntry->second.setInvalid(true);
    }
  }
  return _writeCodeSigningMappingToDisk();
}

KSTErrorRef
KSTCodeSigningMappingState::_onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  std::vector<std::string> orphans;
  for (const auto& [identifier, entry] : codeSigningMappingDict_) {
    if (entry.registeredByCaller()) continue;
    const bool found = hasBundleContainer(identifier, kKSTContainerClassBundleApplication) ||
                       hasBundleContainer(identifier, kKSTContainerClassBundleVantlerPlugin) ||
                       hasBundleContainer(identifier, kKSTContainerClassBundleVPNPlugin);
    if (!found) orphans.push_back(identifier);
  }
  for (const std::string& identifier : orphans) {
    KSTLog(kLogDebug, "Invalidating the code signing info for: %@", identifier);
    codeSigningMappingDict_.at(identifier).setInvalid(true);
  }
  return _writeCodeSigningMappingToDisk();
}

void KSTCodeSigningMappingState::_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(
    std::string_view identifier) {
  std::vector<std::string> identifiers;
  if (const KSTCodeSigningEntry* entry = entryForIdentifier(identifier)) {
    identifiers = entry->childBundleIdentifiers().value_or(std::vector<std::string>{});
  }
  identifiers.emplace_back(identifier);
  for (const std::string& each : identifiers) {
    // Processing without information releases what the entry held (system
    // container, group references) and removes it.
    const std::uint64_t code = _onQueue_processCodeSigningInfo(std::nullopt, each, std::nullopt);
    if (code != kKSTSuccess) {
      KSTLog(kLogError, "Failed to clear entitlements for %@ : %llu", each,
             static_cast<unsigned long long>(code));
    }
  }
}

// ---- The public face ----------------------------------------------------------

KSTCodeSigningMapping& KSTCodeSigningMapping::sharedInstance() {
  static platform::NeverDestroyed<KSTCodeSigningMapping> instance(
      [](void* where) { return new (where) KSTCodeSigningMapping(); });
  return *instance;
}

KSTCodeSigningMapping::KSTCodeSigningMapping()
    : KSTCodeSigningMapping(KSTGlobalConfiguration::sharedInstance().libraryDirectory().appending(
          kKSTCodeSigningMappingFileName, false)) {}

KSTCodeSigningMapping::KSTCodeSigningMapping(KSTFileURL mappingFileURL) {
  state_ = KSTCodeSigningMappingState::_readCodeSigningMappingFromDisk(std::move(mappingFileURL));
  if (!state_) KSTLog(kLogError, "Unable to read mapping file from disk.  This is bad");
  codeSignQueue_ = platform::DispatchQueue::createSerial(kKSTCodeSigningQueueLabel);
}

std::optional<PlistDictionary> KSTCodeSigningMapping::getCodeSigningInfoForIdentifier(
    std::string_view identifier) {
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  return withState(std::optional<PlistDictionary>(), [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_codeSigningInfoForIdentifier(identifier, true);
  });
}

std::uint64_t KSTCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  return withState(std::uint64_t{0}, [&](KSTCodeSigningMappingState& state) {
    std::uint64_t code = kKSTSuccess;
    KSTHandOverCode(state._onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer(), &code);
    return code;
  });
}

bool KSTCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    std::string_view identifier, KSTErrorRef* withError) {
  KSTErrorRef error = withState(KSTErrorRef(), [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier);
  });
  if (!isAvailable()) return false;
  if (error) {
    KSTSetError(withError, std::move(error));
    return false;
  }
  return true;
}

void KSTCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    std::string_view identifier) {
  withState(false, [&](KSTCodeSigningMappingState& state) {
    state._onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier);
    return true;
  });
}

bool KSTCodeSigningMapping::codeSigningInfoExistForIdentifier(std::string_view identifier) {
  return withState(false, [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_codeSigningInfoExistForIdentifier(identifier);
  });
}

bool KSTCodeSigningMapping::identifierHasCallerRegisteredEntitlements(std::string_view identifier) {
  return withState(false, [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_identifierHasCallerRegisteredEntitlements(identifier);
  });
}

bool KSTCodeSigningMapping::identifierHasSystemContainer(std::string_view identifier) {
  return withState(false, [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_identifierHasSystemContainer(identifier);
  });
}

KSTContainerClass KSTCodeSigningMapping::dataContainerTypeForIdentifier(
    std::string_view identifier) {
  return withState(KSTContainerClass{kKSTContainerClassUndefined},
                   [&](KSTCodeSigningMappingState& state) {
                     return state._onQueue_dataContainerTypeForIdentifier(identifier);
                   });
}

KSTGroupIdentifiers KSTCodeSigningMapping::appGroupIdentifiersForIdentifier(
    std::string_view identifier) {
  return withState(KSTGroupIdentifiers(), [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_appGroupIdentifiersForIdentifier(identifier);
  });
}

KSTGroupIdentifiers KSTCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    std::string_view identifier) {
  return withState(KSTGroupIdentifiers(), [&](KSTCodeSigningMappingState& state) {
    return state._onQueue_systemGroupIdentifiersForIdentifier(identifier);
  });
}

void KSTCodeSigningMapping::iterateGroupIdsWithKey(
    std::string_view key, std::optional<std::string_view> fallBackKey,
    const KSTGroupIdsBlock& forAllIdentifiersUsingBlock) {
  if (!isAvailable()) return;
  state_->iterateGroupIdsWithKey(key, fallBackKey, forAllIdentifiersUsingBlock);
}

}  // namespace kestrel
