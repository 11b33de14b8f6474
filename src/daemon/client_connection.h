// The per-request view of a client: its identity and rights. Each request gets
// its own object; the daemon's own work (start-up, upcalls) runs on the shared
// one. Its operations are defined in the folders of the subsystems they belong to.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <sys/types.h>

#include "daemon/errors.h"
#include "operations/replace_journal.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/file_url.h"
#include "store/metadata.h"

namespace kestrel {

class KSTClientConnection {
 public:
  static constexpr const char* kInternalBundleIdentifier = "com.zorvane.kestreld.internal";

  KSTClientConnection(std::optional<std::string> bundleId, std::uint32_t clientUserId,
                      bool allowOtherIdLookup,
                      std::optional<std::vector<std::string>> entitledWipeIdentifiers);
  // initWithBundleId:allowOtherIdLookup: (the client user id is 0).
  KSTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup);

  // The one instance for the daemon's own work, made once.
  static KSTClientConnection& sharedClientConnection();

  const std::optional<std::string>& clientBundleIdentifier() const {
    return clientBundleIdentifier_;
  }
  std::uint32_t clientUserId() const { return clientUserId_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
  const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const {
    return entitledWipeIdentifiers_;
  }

  // Creation and lookup (store/container_creation.cpp). The container of the
  // identifier, made whole in staging and renamed into its class directory
  // when it is not there (and createIfNecessary is set); a transient one is
  // replaced by a fresh one every time. identifier nothing: not a string.
  // Codes 5, 6, 7, 8, 9, 11, 21 (not logged), 40, 45, 55 and those of the
  // cache, the metadata writer and the ACLs.
  KSTMetadataRef createOrLookupContainerForUser(std::uint32_t userId,
                                                const std::optional<std::string>& identifier,
                                                bool createIfNecessary,
                                                KSTContainerClass containerClass, bool transient,
                                                bool useLocking, std::uint64_t* withError);
  // Every container of the class for the user (store/container_listing.cpp).
  std::optional<std::vector<KSTMetadataRef>> containersForUser(std::uint32_t userId,
                                                               KSTContainerClass withClass,
                                                               bool transient,
                                                               std::uint64_t* withError);
  // The directories creation makes.
  bool _createDefaultDirectory(const KSTFileURL& url, mode_t mode, uid_t owner, KSTErrorRef* error);
  bool _createTopLevelContainerDirectory(const KSTFileURL& url, KSTContainerClass containerClass,
                                         uid_t owner, KSTErrorRef* error);
  bool _createSubDirectories(const KSTFileURL& url, std::uint32_t userId,
                             KSTContainerClass containerClass, KSTErrorRef* error);

  // Deletion (operations/container_deletion.cpp). Stage-for-delete renames
  // each container named by entry i of the arrays into death row and drops
  // its sandbox mapping and cache entry (and, for bundles, its code-signing
  // entries); entries of the wrong type are nothing and are skipped with a
  // log line. It never starts a sweep. The code is written only on failure.
  void stageForDeleteContainersWithUsers(
      const std::vector<std::uint32_t>& users,
      const std::vector<std::optional<platform::Uuid>>& UUIDs,
      const std::optional<std::vector<std::optional<std::string>>>& identifiers,
      const std::vector<std::optional<KSTContainerClass>>& classes, bool useLocking,
      std::uint64_t* withError);
  // Looks the container up (without creating it) and stages it for deletion.
  void deleteContainerForUser(std::uint32_t userId,
                              const std::optional<std::string>& withIdentifier,
                              KSTContainerClass containerClass, bool transient,
                              std::uint64_t* withError);

  // Replace (operations/replace.cpp): the container of UUID withContainer
  // takes the place of the one of oldUUID (same class and user), journalled
  // so that a crash half-way is undone at the next start. Without an old
  // container the new one goes to its class directory under its directory
  // name. preserveOldUUID: the new content takes the old path and UUID. The
  // code is written only on failure: 10, 11, 14, 15, 21, 22, 23, 27, 33, 34,
  // 36, 45, 46, 56 and those of the code-signing store.
  void replaceContainer(const std::optional<platform::Uuid>& oldUUID,
                        const std::optional<platform::Uuid>& withContainer, std::uint32_t userIdOld,
                        std::uint32_t userIdNew, const std::optional<std::string>& identifierOld,
                        const std::optional<std::string>& identifierNew,
                        KSTContainerClass containerClassOld, KSTContainerClass containerClassNew,
                        bool preserveOldUUID, bool startDeletionThread, std::uint64_t* withError);
  // The journal: written atomically (binary, protection class none) with all
  // four paths (33 without one, 34 when it cannot be written), and read back
  // (35 when unreadable or not four absolute paths).
  bool _writeToDiskReplaceAt(const std::optional<KSTFileURL>& url,
                             const std::optional<KSTFileURL>& old,
                             const std::optional<KSTFileURL>& withNew,
                             const std::optional<KSTFileURL>& usingStaging,
                             const std::optional<KSTFileURL>& toDestination, KSTErrorRef* error);
  std::optional<KSTReplaceJournal> _readAndValidateReplaceFileAtUrl(const KSTFileURL& url,
                                                                    KSTErrorRef* error);
  // At start-up: every journal left behind is rolled back where the swap
  // stopped half-way, and retired. False (35, 36) stops at that journal; it
  // and the later ones stay for the next start.
  bool _recoverFromReplaceOperationsWithError(KSTErrorRef* error);

  // Wipe (operations/container_wipe.cpp): the data container of the
  // identifier is replaced by a fresh empty one that keeps its path and UUID;
  // its content goes to death row. Refusals log and answer 11, 18 or 55.
  void deleteDataContainerContentForUser(std::uint32_t userId,
                                         const std::optional<std::string>& identifier,
                                         KSTContainerClass containerClass,
                                         std::uint64_t* withError);

  // Shared-content staging (operations/shared_content.cpp): moves the item
  // at sourceRelativePath of the system group container `identifier` (which
  // the client must be entitled to) to destRelativePath in it, after
  // resetting its ACLs. Both paths must stay within the container, and the
  // ACL reset and the move act through descriptors beneath it. The
  // destination URL, or nothing with 10, 11, 21, 38, 55, 63 or 64.
  std::optional<KSTFileURL> stageSharedContentForIdentifier(
      const std::optional<std::string>& identifier,
      const std::optional<std::string>& sourceRelativePath,
      const std::optional<std::string>& destRelativePath, std::uint64_t* withError);

  // Info values and the metadata record (operations/info_values.cpp). The
  // container is the cached one of the user, class, identifier and internal
  // UUID; the identifier lock of that UUID's text is held for writing by set
  // (across the change, the metadata file's write and the cache update) and
  // for reading by the queries. The info operations lock only with
  // useLocking; the metadata query always does. An absent value removes the
  // key. Codes: 11 (no UUID, or a class outside 1..13), 38 (no key), 21 (no
  // such container), 24 (no such key; not logged), 45, and the metadata
  // writer's own.
  void setInfoValue(const std::optional<PlistValue>& value,
                    const std::optional<std::string>& forKey, std::uint32_t userId,
                    const std::optional<platform::Uuid>& uuid,
                    const std::optional<std::string>& identifier, KSTContainerClass containerClass,
                    bool useLocking, std::uint64_t* withError);
  std::optional<PlistValue> infoValueForKey(const std::optional<std::string>& key,
                                            std::uint32_t userId,
                                            const std::optional<platform::Uuid>& uuid,
                                            const std::optional<std::string>& identifier,
                                            KSTContainerClass containerClass, bool useLocking,
                                            std::uint64_t* withError);
  KSTMetadataRef metadataForUser(std::uint32_t userId,
                                 const std::optional<platform::Uuid>& withUUID,
                                 const std::optional<std::string>& identifier,
                                 KSTContainerClass containerClass, std::uint64_t* withError);

  // Repairs (operations/structure_repair.cpp) of the cached container of the
  // user, class, identifier and internal UUID, each holding the identifier
  // lock of that UUID's text for writing throughout. Recreating puts back the
  // class's default sub-directories (and resets the ACLs of a system
  // container); regenerating renames the container directory to a new random
  // UUID in the same class directory and points the sandbox mapping and the
  // cache there, its internal UUID unchanged. Codes: 11, 21, 45, 48 and those
  // of the sub-directory and ACL operations.
  void recreateDefaultStructureForUser(std::uint32_t userId,
                                       const std::optional<platform::Uuid>& withUUID,
                                       const std::optional<std::string>& identifier,
                                       KSTContainerClass containerClass, std::uint64_t* withError);
  void regenerateDirectoryUUIDForUser(std::uint32_t userId,
                                      const std::optional<platform::Uuid>& withInternalUUID,
                                      const std::optional<std::string>& identifier,
                                      KSTContainerClass containerClass, std::uint64_t* withError);

  // Disk usage (operations/disk_usage.cpp): the bytes the container's files
  // take, measured under the UUID's identifier lock held for writing. A bundle
  // container's figure is kept in its info dictionary and reused; data
  // containers are measured every time. 0 with 11 or 21; failures to read or
  // keep the figure are logged and change nothing.
  std::uint64_t diskUsageForUserId(std::uint32_t userId, const std::optional<platform::Uuid>& uuid,
                                   const std::optional<std::string>& identifier,
                                   KSTContainerClass containerClass, std::uint64_t* withError);

  // The retry test (operations/retry_test.cpp): counts down the crashes still
  // to come, kept in the user's test container "com.zorvane.retryTest", and
  // ends the process without a reply while any remain; the request that
  // counts down to zero deletes the container and succeeds.
  void retryTestForUser(std::uint32_t userId, std::uint64_t withNumCrashes,
                        std::uint64_t* withError);

  // Start-up and boot housekeeping of the container store.
  void rebootContainerManagerSetup();
  void containerManagerSetup();
  void rebootContainerManagerCleanup();
  void containerManagerCleanup();
  // Retires what does not belong in the class directory: entries named
  // neither by a UUID nor by a well-known name, and containers without a
  // metadata file.
  void _cleanupOrphanedDataForUser(std::uint32_t userId, KSTContainerClass containerClass);

  bool _setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                          KSTContainerClass containerClass,
                                          const std::optional<KSTFileURL>& url);

  // Death row (operations/death_row.cpp). The two moves run on the caller's
  // thread; the sweep runs later on the death-row queue and hands its code to
  // the completion there (when one is given).
  bool _removeItemOrMoveToTempAtURL(const KSTFileURL& url, KSTErrorRef* error);
  bool _moveItemAtURLToDeathRow(const KSTFileURL& url, bool isDir, bool startDeletionThread,
                                KSTErrorRef* error);
  void deleteContainersOnDeathRowWithCompletion(std::function<void(std::uint64_t code)> completion);

 private:
  std::optional<std::string> clientBundleIdentifier_;
  std::uint32_t clientUserId_ = 0;
  bool allowOtherIdLookup_ = false;
  bool allowGroupIdLookup_ = false;
  std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};

}  // namespace kestrel
