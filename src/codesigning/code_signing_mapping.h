// The process-wide store of code-signing entries, identifier -> entry, kept in
// memory and persisted whole in "kst_code_signing_info.plist" of the library
// directory.
//
// Every access runs on the serial queue "com.zorvane.Kestrel.EntitlementQueue".
// The split below makes a hop onto that queue from the queue itself (which
// would never return) impossible to write by accident:
//   - KSTCodeSigningMappingState holds the entries and every operation that
//     runs on the queue (the "_onQueue_" functions). It knows nothing of the
//     public class, so nothing it does can hop.
//   - KSTCodeSigningMapping is the thin public face: each operation hops onto
//     the queue and calls into the state. The state is reachable only through
//     withState(), which aborts when called from the queue.
// The operations that change the store take the lock on all identifiers for
// writing before the hop and release it after it; nothing on the queue takes
// that lock.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "codesigning/code_signing_entry.h"
#include "daemon/errors.h"
#include "daemon/invariant.h"
#include "platform/dispatch.h"
#include "store/file_url.h"

namespace kestrel {

inline constexpr const char* kKSTCodeSigningQueueLabel = "com.zorvane.Kestrel.EntitlementQueue";
inline constexpr const char* kKSTCodeSigningMappingFileName = "kst_code_signing_info.plist";

// Keys of the code-signing information and of its entitlements.
inline constexpr const char* kKSTEntitlementsKey = "com.zorvane.Kestrel.Entitlements";
inline constexpr const char* kKSTApplicationGroupsEntitlement =
    "com.zorvane.security.application-groups";
inline constexpr const char* kKSTSystemGroupsEntitlement = "com.zorvane.security.system-groups";
inline constexpr const char* kKSTSystemGroupContainersEntitlement =
    "com.zorvane.security.system-group-containers";
inline constexpr const char* kKSTSystemContainerEntitlement =
    "com.zorvane.security.system-container";
inline constexpr const char* kKSTSystemGroupPrefix = "systemgroup.";
// Keys of the options that come with new code-signing information.
inline constexpr const char* kKSTDataContainerClassOption =
    "com.zorvane.Kestrel.DataContainerClass";
inline constexpr const char* kKSTParentBundleIDOption = "com.zorvane.Kestrel.ParentBundleID";
inline constexpr const char* kKSTRegisteredByCallerOption = "RegByCaller";
inline constexpr const char* kKSTPlaceholderEntitlementsOption =
    "com.zorvane.Kestrel.PlaceholderEntitlements";
// Where a bundle container's info keeps the installer's cached information.
inline constexpr const char* kKSTCachedCodeSigningInfoKey =
    "com.zorvane.Tessel.CachedCodeSigningInfo";
// Where a data container's info kept its application groups in older releases.
inline constexpr const char* kKSTGroupContainerIDsKey = "com.zorvane.Tessel.GroupContainerIDs";
// The file in the library directory in which older releases kept every
// identifier's entitlements, and its reserved keys.
inline constexpr const char* kKSTLegacyEntitlementsFileName = "kst_entitlements.plist";
inline constexpr const char* kKSTLegacyChildPluginBundleIDsKey =
    "com.zorvane.Kestrel.ChildPluginBundleIDs";
inline constexpr const char* kKSTLegacyEntitlementsRegisteredByCallerKey =
    "com.zorvane.Kestrel.EntitlementsRegisteredByCaller";
inline constexpr const char* kKSTLegacyPlaceholderEntitlementsKey =
    "com.zorvane.Kestrel.PlaceholderEntitlements";

using KSTGroupIdentifiers = std::optional<std::vector<std::string>>;
using KSTGroupIdsBlock =
    std::function<void(const std::string& identifier, const KSTGroupIdentifiers& groupIds)>;

// The entries and the operations that run on the mapping's queue.
class KSTCodeSigningMappingState {
 public:
  // Loads the mapping file at url. A missing file gives an empty store; an
  // unreadable one (or one that is not a dictionary) gives nullptr.
  static std::unique_ptr<KSTCodeSigningMappingState> _readCodeSigningMappingFromDisk(
      KSTFileURL url);

  // Writes every entry; error 59 on failure. The entries stay as they are.
  KSTErrorRef _writeCodeSigningMappingToDisk() const;
  // Sets each value for its identifier (an entry without information removes
  // the identifier) and saves when anything changed. Error 60 when the counts
  // differ, or the save's error.
  KSTErrorRef _setCodeSigningDictionaryValues(const std::vector<KSTCodeSigningEntry>& values,
                                              const std::vector<std::string>& forIdentifiers);

  // The group identifiers of one entitlement: a string or an array of strings.
  static KSTGroupIdentifiers _copyApplicationGroupEntitlementForIdentifier(
      std::string_view identifier, const std::optional<PlistDictionary>& entitlements,
      std::string_view groupKey);

  // The stored entry, without any fallback; nullptr when there is none.
  const KSTCodeSigningEntry* entryForIdentifier(std::string_view identifier) const;

  // The identifier's information; an external request does not see placeholder
  // or invalid entries. Without an entry, information cached in the
  // identifier's bundle container is migrated into the store first.
  std::optional<PlistDictionary> _onQueue_codeSigningInfoForIdentifier(std::string_view identifier,
                                                                       bool externalRequest);
  std::optional<PlistDictionary> _onQueue_entitlementsForIdentifier(std::string_view identifier);

  bool _onQueue_codeSigningInfoExistForIdentifier(std::string_view identifier);
  bool _onQueue_identifierHasCallerRegisteredEntitlements(std::string_view identifier) const;
  bool _onQueue_identifierHasSystemContainer(std::string_view identifier);
  KSTContainerClass _onQueue_dataContainerTypeForIdentifier(std::string_view identifier) const;
  KSTGroupIdentifiers _onQueue_appGroupIdentifiersForIdentifier(std::string_view identifier);
  KSTGroupIdentifiers _onQueue_systemGroupIdentifiersForIdentifier(std::string_view identifier);

  KSTErrorRef _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(
      std::string_view identifier);
  KSTErrorRef _onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  // Runs the processing with no information for each child of the
  // identifier, in order, then for the identifier itself; failures are logged.
  void _onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(
      std::string_view identifier);

  // Makes new information (none: removal) the identifier's entry: links a
  // plug-in to its parent, stages the system container for deletion when its
  // entitlement has gone and lets the group manager drop the groups that are
  // no longer named, all before the store changes. Returns 1, 18 without an
  // identifier, the save's code (59, 60) or 40 for an exception. Runs with the
  // lock on all identifiers held for writing (code_signing_processing.cpp).
  std::uint64_t _onQueue_processCodeSigningInfo(const std::optional<PlistDictionary>& info,
                                                const std::optional<std::string>& forIdentifier,
                                                const std::optional<PlistDictionary>& withOptions);
  // True when the identifier's entry is already what processing its own
  // entitlements (registered by itself) would make of it, so that processing
  // them again would change nothing.
  bool _onQueue_callerRegisteredInfoIsCurrent(const std::string& identifier,
                                              const PlistDictionary& info) const;

  // Calls block for every entry, invalid and placeholder ones included, with
  // the parsed key (or the fallback key when the key gives none or an empty list).
  void iterateGroupIdsWithKey(std::string_view key, std::optional<std::string_view> fallBackKey,
                              const KSTGroupIdsBlock& block);

  // Takeover of older code-signing data (code_signing_migration.cpp), each
  // until it completes once: the application groups kept in data containers'
  // info (marker "kst_group_id_migration_complete.plist"), the legacy
  // entitlements file (done once the file is gone), and the information the
  // installer cached in bundle containers' info (marker
  // "kst_code_signing_migration_complete.plist"). They run on the queue with
  // the lock on all identifiers held for writing, and clear the old copies
  // without taking container locks. Failures are logged only.
  void _migrateAppGroupIdsFromDataContainersToFile();
  void _migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
  void _migrateCachedCodeSigningInfoFromBundleContainersToMapping();

  const KSTFileURL& mappingFileURL() const { return url_; }

 private:
  explicit KSTCodeSigningMappingState(KSTFileURL url) : url_(std::move(url)) {}

  KSTFileURL url_;
  std::map<std::string, KSTCodeSigningEntry, std::less<>> codeSigningMappingDict_;
};

class KSTCodeSigningMapping {
 public:
  static KSTCodeSigningMapping& sharedInstance();

  // Loads the mapping file of the library directory, or the one at url (for
  // tests, which may make several stores). When the file cannot be read the
  // store is unavailable: every operation does nothing and returns its empty
  // value (none, NO, 0, code 0).
  KSTCodeSigningMapping();
  explicit KSTCodeSigningMapping(KSTFileURL mappingFileURL);
  KSTCodeSigningMapping(const KSTCodeSigningMapping&) = delete;
  KSTCodeSigningMapping& operator=(const KSTCodeSigningMapping&) = delete;

  bool isAvailable() const { return state_ != nullptr && codeSignQueue_ != nullptr; }

  // Command 24's last step: the three migrations above, in order, then the
  // removal of every application group container that no entry names. Takes
  // the lock on all identifiers for writing and runs on the queue.
  void performAllCodeSigningMigrationAndReconciliation();

  // Command 19: the information as an external request sees it.
  std::optional<PlistDictionary> getCodeSigningInfoForIdentifier(std::string_view identifier);
  // Command 20: 1, or the save error's code.
  std::uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  bool invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier,
                                                            KSTErrorRef* withError);
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view identifier);

  // Command 18 and admission: processes the information under the lock on all
  // identifiers (held for writing). 1 on success; 0 when the store is unavailable.
  std::uint64_t processCodeSigningInfo(const std::optional<PlistDictionary>& info,
                                       const std::optional<std::string>& forIdentifier,
                                       const std::optional<PlistDictionary>& withOptions);
  // The client's own entitlements, registered by itself: processed as the
  // information {Entitlements: entitlements} with the option RegByCaller.
  // Entitlements that are already the entry's change nothing and are not
  // processed again, so the lock on all identifiers is not taken for them.
  std::uint64_t processCallerRegisteredEntitlements(
      const PlistDictionary& entitlements, const std::optional<std::string>& forIdentifier);
  // Admission's question, in one visit to the queue: the identifier has no
  // information, or registered its own, and `entitlements` are not what its
  // entry holds already. True as well when the store is unavailable, so that
  // the processing reports it.
  bool callerRegisteredEntitlementsNeedProcessing(const PlistDictionary& entitlements,
                                                  const std::string& identifier);

  bool codeSigningInfoExistForIdentifier(std::string_view identifier);
  bool identifierHasCallerRegisteredEntitlements(std::string_view identifier);
  bool identifierHasSystemContainer(std::string_view identifier);
  KSTContainerClass dataContainerTypeForIdentifier(std::string_view identifier);
  KSTGroupIdentifiers appGroupIdentifiersForIdentifier(std::string_view identifier);
  KSTGroupIdentifiers systemGroupIdentifiersForIdentifier(std::string_view identifier);

  // Does not hop: reads the store on the calling thread, which must be the
  // queue itself or hold the lock on all identifiers for writing.
  void iterateGroupIdsWithKey(std::string_view key, std::optional<std::string_view> fallBackKey,
                              const KSTGroupIdsBlock& forAllIdentifiersUsingBlock);

  // Runs fn(state) synchronously on the queue and returns its result, or
  // emptyValue when the store is unavailable. Never call it from the queue.
  template <typename Result, typename Fn>
  Result withState(Result emptyValue, Fn&& fn) {
    if (!isAvailable()) return emptyValue;
    KST_INVARIANT(!codeSignQueue_->isCurrent());
    Result result = std::move(emptyValue);
    codeSignQueue_->sync([&] { result = fn(*state_); });
    return result;
  }

 private:
  std::unique_ptr<KSTCodeSigningMappingState> state_;
  std::shared_ptr<platform::DispatchQueue> codeSignQueue_;
};

}  // namespace kestrel
