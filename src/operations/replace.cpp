// Replace: one container (the new one) takes the place of another (the old
// one) of the same class and user. The one multi-step directory swap of the
// daemon, made safe by a journal: before the first move, "<id>.plist" in the
// Replace directory records the four directories involved, and whatever
// happens after, the next start finds the swap whole or undoes it.
//
//   journal written  ->  old parked in Staging/<id>  ->  new at the destination
//   ->  staging and journal to death row
//
// A failure while the old container is parked and the new one not yet in
// place moves the old one back, as recovery would, before the journal goes;
// when even that fails, staging and journal stay for the next start.
#include <cerrno>
#include <set>
#include <string>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "operations/replace_journal.h"
#include "platform/crash_point.h"
#include "platform/uuid.h"
#include "store/container_cache.h"
#include "store/container_identifier.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/plist_io.h"

namespace kestrel {

PlistDictionary KSTReplaceJournal::dictionary() const {
  return {{kKSTReplaceOperationOldURLKey, PlistValue(oldURL.path())},
          {kKSTReplaceOperationNewURLKey, PlistValue(newURL.path())},
          {kKSTReplaceOperationStagingURLKey, PlistValue(stagingURL.path())},
          {kKSTReplaceOperationDestURLKey, PlistValue(destURL.path())}};
}

std::string KSTReplaceJournal::description() const {
  return PlistValue(dictionary()).description();
}

namespace {

constexpr const char* kReplace = "replaceContainer";

// One replace with an old or without, under the lock on all identifiers.
class ReplaceOperation {
 public:
  ReplaceOperation(KSTClientConnection& client, const std::optional<platform::Uuid>& oldUUID,
                   const platform::Uuid& newUUID, std::uint32_t oldUser, std::uint32_t newUser,
                   const std::optional<std::string>& oldIdentifier,
                   const std::optional<std::string>& newIdentifier, KSTContainerClass oldClass,
                   KSTContainerClass newClass, bool preserveOldUUID, bool startDeletionThread)
      : client_(client),
        oldUUID_(oldUUID),
        newUUID_(newUUID),
        oldUser_(oldUser),
        newUser_(newUser),
        oldIdentifier_(oldIdentifier),
        newIdentifier_(newIdentifier),
        oldClass_(oldClass),
        newClass_(newClass),
        preserveOldUUID_(preserveOldUUID),
        startDeletionThread_(startDeletionThread) {}

  // Steps 5 on; the result, or nothing on success.
  KSTErrorRef run() {
    KSTErrorRef result = swap();
    if (oldUUID_) return exitSteps(std::move(result));
    synchronizeTouched();
    return result;
  }

 private:
  KSTContainerCache& cache() { return KSTContainerCache::sharedInstance(); }
  const KSTFileManager& files() { return KSTFileManager::defaultManager(); }

  KSTErrorRef notFound(std::uint32_t user, const platform::Uuid& uuid,
                       const std::optional<std::string>& identifier, KSTContainerClass c) {
    return KST_ERROR_IN(kReplace, kKSTErrorNotFound, nullptr, true,
                        "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld", user,
                        uuid.string(), KSTIdentifierForLog(identifier), c);
  }

  KSTErrorRef swap() {
    // 5-6.
    if (oldUUID_) {
      old_ = cache().containerForUser(oldUser_, oldClass_, oldIdentifier_, oldUUID_->string());
      if (!old_) return notFound(oldUser_, *oldUUID_, oldIdentifier_, oldClass_);
    }
    new_ = cache().containerForUser(newUser_, newClass_, newIdentifier_, newUUID_.string());
    if (!new_) return notFound(newUser_, newUUID_, newIdentifier_, newClass_);
    const KSTFileURL newURL = new_->url();
    const bool oldTransient = old_ ? old_->transient() : false;
    const bool newTransient = new_->transient();

    // 7-9.
    if (old_ && old_->url() == newURL) {
      return KST_ERROR_IN(kReplace, kKSTErrorReplaceSameContainer, nullptr, true,
                          "Can't replace the same container at %@", newURL);
    }
    const std::optional<platform::Uuid> directoryUUID =
        platform::Uuid::parse(newURL.lastPathComponent());
    if (!directoryUUID) {
      return KST_ERROR_IN(kReplace, kKSTErrorInvalidURL, nullptr, true,
                          "Invalid URL (last path component not UUID): %@", newURL);
    }
    if (preserveOldUUID_) {
      destination_ = old_->url();
    } else if (const std::optional<KSTFileURL> classDirectory =
                   KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
                       newUser_, newClass_, oldTransient)) {
      destination_ = classDirectory->appending(directoryUUID->string(), true);
      if (files().itemExistsAtURL(*destination_)) {
        return KST_ERROR_IN(kReplace, kKSTErrorAlreadyExists, nullptr, true,
                            "Container already exists at %@", *destination_);
      }
    } else {
      return KST_ERROR_IN(kReplace, kKSTErrorReplaceFailed, nullptr, true,
                          "Failed to replace: %@ with: %@ at: %@",
                          old_ ? old_->url() : KSTFileURL(), newURL, nullptr);
    }

    if (!old_) {
      // 10. Without an old container, one of that identifier must not be live.
      KSTErrorRef lookupError;
      if (cache().containerForUser(newUser_, newClass_, new_->identifier(), false, &lookupError)) {
        return KST_ERROR_IN(kReplace, kKSTErrorAlreadyExists, nullptr, true,
                            "Container with identifier: %@, class: %ld, transient: %d already "
                            "exists",
                            new_->identifier(), newClass_, 0);
      }
      if (!lookupError || lookupError->domain() != kKSTErrorDomain ||
          lookupError->code() != kKSTErrorNotFound) {
        return lookupError;
      }
    } else {
      // 11-14.
      if (KSTErrorRef failure = parkOld(); failure) return failure;
    }

    // The new content takes the old UUID on disk too, before it moves, so
    // that the container keeps it across restarts.
    if (preserveOldUUID_) {
      if (KSTErrorRef failure = writeUUID(newURL, old_->uuid()); failure) return failure;
    }

    // 15.
    KSTErrorRef moveError;
    if (!files().moveItemAtURL(newURL, *destination_, &moveError)) {
      return KST_ERROR_IN(kReplace, kKSTErrorReplaceFailed, moveError, true,
                          "Failed to replace: %@ with: %@ at: %@",
                          old_ ? old_->url() : KSTFileURL(), newURL, *destination_);
    }
    newInPlace_ = true;
    touched_.insert(newURL.deletingLastPathComponent().path());
    touched_.insert(destination_->deletingLastPathComponent().path());
    KST_CRASH_POINT("replace.new-in-place");

    // 16-19.
    KSTErrorRef cacheError;
    if (!cache().removeContainerForUser(newUser_, newClass_, new_->identifier(), newTransient,
                                        &cacheError)) {
      return KST_ERROR_IN(kReplace, kKSTErrorCacheRemoveFailed, cacheError, true,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d",
                          new_->identifier(), newClass_, newTransient ? 1 : 0);
    }
    if (!client_._setSandboxContainerMappingForUser(newUser_, new_->identifier(), newClass_,
                                                    *destination_)) {
      KSTLogTag(kLogError, kReplace,
                "Failed to set container mapping in replace operation of %@, %llu",
                new_->identifier(), newClass_);
    }
    if (preserveOldUUID_) new_->setUuid(old_->uuid());
    if (!cache().addContainerMetadata(new_, newUser_, *destination_, oldTransient, &cacheError)) {
      return KST_ERROR_IN(kReplace, kKSTErrorCacheAddFailed, cacheError, true,
                          "Failed to add to cache: %@, url: %@, transient: %d", new_, *destination_,
                          oldTransient ? 1 : 0);
    }
    KST_CRASH_POINT("replace.cached");
    return nullptr;
  }

  // Steps 11 to 14: the journal, then the old container into staging and out
  // of the cache, and a bundle's code-signing entries invalidated.
  KSTErrorRef parkOld() {
    KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
    const std::string operationId = platform::Uuid::random().string();
    journal_ = layout.replaceDirectory().appending(operationId + ".plist");
    staging_ = layout.stagingDirectory().appending(operationId, true);
    KSTErrorRef writeError;
    if (!client_._writeToDiskReplaceAt(*journal_, old_->url(), new_->url(), *staging_,
                                       *destination_, &writeError)) {
      KSTLogTag(kLogError, kReplace, "Failed to write replace file: %@", writeError);
      journal_.reset();
      return writeError;
    }
    KST_CRASH_POINT("replace.journal-written");

    KSTErrorRef moveError;
    if (!files().moveItemAtURL(old_->url(), *staging_, &moveError)) {
      return KST_ERROR_IN(kReplace, kKSTErrorReplaceStagingFailed, moveError, true,
                          "Failed to move old %@ to staging %@", old_->url(), *staging_);
    }
    oldParked_ = true;
    touched_.insert(old_->url().deletingLastPathComponent().path());
    touched_.insert(staging_->deletingLastPathComponent().path());
    KST_CRASH_POINT("replace.old-parked");

    KSTErrorRef cacheError;
    const bool oldTransient = old_->transient();
    if (!cache().removeContainerForUser(oldUser_, oldClass_, oldIdentifier_, oldTransient,
                                        &cacheError)) {
      return KST_ERROR_IN(kReplace, kKSTErrorCacheRemoveFailed, cacheError, true,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d",
                          KSTIdentifierForLog(oldIdentifier_), oldClass_, oldTransient ? 1 : 0);
    }
    oldUncached_ = true;

    if (KSTIsBundleClass(oldClass_) && oldIdentifier_) {
      KSTErrorRef invalidateError;
      if (!KSTCodeSigningMapping::sharedInstance()
               .invalidateCodeSigningInfoForIdentifierAndItsChildren(*oldIdentifier_,
                                                                     &invalidateError)) {
        KSTLogTag(kLogError, kReplace, "Failed to invalidate code signing info for %@",
                  *oldIdentifier_);
        return invalidateError;
      }
    }
    return nullptr;
  }

  // The new container's metadata file with the old container's UUID.
  KSTErrorRef writeUUID(const KSTFileURL& newURL, const platform::Uuid& uuid) {
    const KSTMetadataRef record = KSTMetadata::initWithUserId(
        new_->uid(), uuid, new_->containerClass(), new_->identifier(), new_->info(), newURL);
    KSTErrorRef writeError;
    if (!record->writeMetadataToDiskWithError(&writeError)) return writeError;
    KST_CRASH_POINT("replace.uuid-written");
    return nullptr;
  }

  // Step 20, and the roll-back of a swap that stopped half-way.
  KSTErrorRef exitSteps(KSTErrorRef result) {
    if (oldParked_ && !newInPlace_ && !rollBack()) {
      // Staging and journal stay: the next start moves the old one back.
      return result;
    }
    // What the moves changed reaches the disk before the journal goes.
    synchronizeTouched();
    if (staging_) {
      KSTErrorRef moveError;
      if (!client_._moveItemAtURLToDeathRow(*staging_, true, false, &moveError)) {
        result = KST_ERROR_IN(kReplace, kKSTErrorReplaceCleanupFailed, moveError, true,
                              "Failed to remove staging dir: %@", *staging_);
      }
      KST_CRASH_POINT("replace.staging-retired");
    }
    if (journal_) {
      KSTErrorRef moveError;
      if (!client_._moveItemAtURLToDeathRow(*journal_, false, startDeletionThread_, &moveError)) {
        result = KST_ERROR_IN(kReplace, kKSTErrorReplaceCleanupFailed, moveError, true,
                              "Failed to remove replace file: %@", *journal_);
      }
      KST_CRASH_POINT("replace.journal-retired");
    }
    return result;
  }

  // Flushes every directory whose entries a move changed (and those above it).
  void synchronizeTouched() {
    for (const std::string& directory : touched_) {
      KSTErrorRef syncError;
      if (!files().synchronizeDirectoryAndAncestorsAtURL(KSTFileURL(directory, true), &syncError)) {
        KSTLogTag(kLogError, kReplace, "%@", syncError);
      }
    }
  }

  // Moves the parked old container back to its place and into the cache.
  bool rollBack() {
    KSTErrorRef moveError;
    if (!files().moveItemAtURL(*staging_, old_->url(), &moveError)) {
      KST_ERROR_IN(kReplace, kKSTErrorReplaceRecoveryFailed, moveError, true,
                   "Failed to recover replace move: %@ to %@", *staging_, old_->url());
      return false;
    }
    KST_CRASH_POINT("replace.rolled-back");
    if (oldUncached_) {
      KSTErrorRef cacheError;
      if (!cache().addContainerMetadata(old_, oldUser_, old_->url(), old_->transient(),
                                        &cacheError)) {
        KSTLogTag(kLogError, kReplace, "Failed to add to cache: %@, url: %@, transient: %d", old_,
                  old_->url(), old_->transient() ? 1 : 0);
      }
    }
    return true;
  }

  KSTClientConnection& client_;
  const std::optional<platform::Uuid>& oldUUID_;
  const platform::Uuid& newUUID_;
  const std::uint32_t oldUser_;
  const std::uint32_t newUser_;
  const std::optional<std::string>& oldIdentifier_;
  const std::optional<std::string>& newIdentifier_;
  const KSTContainerClass oldClass_;
  const KSTContainerClass newClass_;
  const bool preserveOldUUID_;
  const bool startDeletionThread_;

  KSTMetadataRef old_;
  KSTMetadataRef new_;
  std::optional<KSTFileURL> destination_;
  std::optional<KSTFileURL> journal_;
  std::optional<KSTFileURL> staging_;
  bool oldParked_ = false;
  bool oldUncached_ = false;
  bool newInPlace_ = false;
  // Directories whose entries a move changed.
  std::set<std::string> touched_;
};

}  // namespace

void KSTClientConnection::replaceContainer(const std::optional<platform::Uuid>& oldUUID,
                                           const std::optional<platform::Uuid>& withContainer,
                                           std::uint32_t userIdOld, std::uint32_t userIdNew,
                                           const std::optional<std::string>& identifierOld,
                                           const std::optional<std::string>& identifierNew,
                                           KSTContainerClass containerClassOld,
                                           KSTContainerClass containerClassNew,
                                           bool preserveOldUUID, bool startDeletionThread,
                                           std::uint64_t* withError) {
  // 1-3, without a lock.
  if (!withContainer || !KSTIsValidContainerClass(containerClassNew)) {
    KSTHandOverCode(KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                              "Can't act on an invalid object: new userId: %u, newUUID: %@, "
                              "Class: %ld",
                              userIdNew, withContainer, containerClassNew),
                    withError);
    return;
  }
  if (oldUUID) {
    KSTErrorRef invalid;
    if (!KSTIsValidContainerClass(containerClassOld)) {
      invalid = KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                          "Can't act on an invalid object: old userId: %u, oldUUID: %@, Class: %ld",
                          userIdOld, oldUUID, containerClassOld);
    } else if (containerClassOld != containerClassNew) {
      invalid = KST_ERROR(kKSTErrorClassMismatch, nullptr, true,
                          "Can't replace containers of different class types: %ld and %ld",
                          containerClassOld, containerClassNew);
    } else if (userIdOld != userIdNew) {
      invalid = KST_ERROR(kKSTErrorUserMismatch, nullptr, true,
                          "Can't replace containers of different userIds: %u and %u", userIdOld,
                          userIdNew);
    }
    if (invalid) {
      KSTHandOverCode(invalid, withError);
      return;
    }
  } else if (preserveOldUUID) {
    KSTHandOverCode(KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                              "Can't have a nil oldContainerUUID when preserving the UUID"),
                    withError);
    return;
  }

  KSTErrorRef failure;
  KST_CATCH_EXCEPTIONS(withError, [&] {
    KSTAllIdentifiersLockGuard lock(kKSTLockForWriting);
    ReplaceOperation operation(*this, oldUUID, *withContainer, userIdOld, userIdNew, identifierOld,
                               identifierNew, containerClassOld, containerClassNew, preserveOldUUID,
                               startDeletionThread);
    failure = operation.run();
  });
  if (failure) KSTHandOverCode(failure, withError);
}

bool KSTClientConnection::_writeToDiskReplaceAt(const std::optional<KSTFileURL>& url,
                                                const std::optional<KSTFileURL>& old,
                                                const std::optional<KSTFileURL>& withNew,
                                                const std::optional<KSTFileURL>& usingStaging,
                                                const std::optional<KSTFileURL>& toDestination,
                                                KSTErrorRef* error) {
  if (!url || !old || !withNew || !usingStaging || !toDestination) {
    KSTSetError(error,
                KST_ERROR(kKSTErrorInvalidReplaceInfo, nullptr, true,
                          "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@", old,
                          withNew, usingStaging, toDestination));
    return false;
  }
  const KSTReplaceJournal journal{*old, *withNew, *usingStaging, *toDestination};
  KSTErrorRef writeError;
  if (KST_writeToURL(journal.dictionary(), *url, kKSTDaemonFileWritingOptions, &writeError)) {
    return true;
  }
  KSTSetError(error, KST_ERROR(kKSTErrorWriteFailed, writeError, true,
                               "Failed to write replace dictionary to URL %@", *url));
  return false;
}

std::optional<KSTReplaceJournal> KSTClientConnection::_readAndValidateReplaceFileAtUrl(
    const KSTFileURL& url, KSTErrorRef* error) {
  KSTErrorRef readError;
  const std::optional<PlistDictionary> dictionary =
      KST_dictionaryWithContentsOfURL(url, kKSTPropertyListImmutable, &readError);
  if (!dictionary) {
    if (readError && readError->domain() == kPropertyListErrorDomain &&
        readError->code() == kPropertyListFormattingError) {
      KSTSetError(error, KST_ERROR(kKSTErrorReplaceRecoveryFailed, readError, true,
                                   "Bad Data in replace file: %@", url));
    } else {
      KSTSetError(error, KST_ERROR(kKSTErrorReplaceRecoveryFailed, readError, true,
                                   "Failed to read replace file at URL %@", url));
    }
    return std::nullopt;
  }
  const auto value = [&](const char* key) -> std::optional<PlistValue> {
    const auto found = dictionary->find(key);
    if (found == dictionary->end()) return std::nullopt;
    return found->second;
  };
  const std::optional<PlistValue> values[] = {
      value(kKSTReplaceOperationOldURLKey), value(kKSTReplaceOperationNewURLKey),
      value(kKSTReplaceOperationStagingURLKey), value(kKSTReplaceOperationDestURLKey)};
  bool valid = true;
  // Each must be a string naming an absolute path: nothing else makes a directory URL.
  for (const std::optional<PlistValue>& v : values) {
    valid = valid && v && v->string() != nullptr && v->string()->starts_with('/');
  }
  if (!valid) {
    KSTSetError(error, KST_ERROR(kKSTErrorReplaceRecoveryFailed, nullptr, true,
                                 "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                                 values[0], values[1], values[2], values[3]));
    return std::nullopt;
  }
  return KSTReplaceJournal{
      KSTFileURL(*values[0]->string(), true), KSTFileURL(*values[1]->string(), true),
      KSTFileURL(*values[2]->string(), true), KSTFileURL(*values[3]->string(), true)};
}

bool KSTClientConnection::_recoverFromReplaceOperationsWithError(KSTErrorRef* error) {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  const KSTFileURL replaceDirectory = KSTGlobalConfiguration::sharedInstance().replaceDirectory();
  KSTErrorRef listError;
  const std::optional<std::vector<KSTFileURL>> journals =
      files.urlsForItemsInDirectoryAtURL(replaceDirectory, &listError);
  if (!journals) {
    if (!listError || !listError->isPOSIXError(ENOENT)) {
      KSTLog(kLogError, "Failed to get items at replace URL%@ : %@", replaceDirectory, listError);
    }
    return true;
  }
  for (const KSTFileURL& url : *journals) {
    KSTErrorRef readError;
    if (const std::optional<KSTReplaceJournal> journal =
            _readAndValidateReplaceFileAtUrl(url, &readError)) {
      KSTLog(kLogDebug, "Doing a replace of %@ with info: %@", url, journal->description());
      if (!files.itemExistsAtURL(journal->oldURL) && !files.itemExistsAtURL(journal->destURL)) {
        // The old one is parked and the new one never arrived: move it back.
        KSTLog(kLogDebug, "Recovering from failed replace by moving: %@ to %@", journal->stagingURL,
               journal->oldURL);
        KSTErrorRef moveError;
        if (!files.moveItemAtURL(journal->stagingURL, journal->oldURL, &moveError)) {
          KSTSetError(error, KST_ERROR(kKSTErrorReplaceRecoveryFailed, moveError, true,
                                       "Failed to recover replace move: %@ to %@",
                                       journal->stagingURL, journal->oldURL));
          return false;
        }
        KST_CRASH_POINT("recovery.rolled-back");
        // Back in place for good before the journal that says how goes.
        for (const KSTFileURL& moved : {journal->oldURL, journal->stagingURL}) {
          KSTErrorRef syncError;
          if (!files.synchronizeDirectoryAndAncestorsAtURL(moved.deletingLastPathComponent(),
                                                           &syncError)) {
            KSTLog(kLogError, "%@", syncError);
          }
        }
      }
    }
    KSTErrorRef moveError;
    if (!_moveItemAtURLToDeathRow(url, false, false, &moveError)) {
      KSTSetError(error, KST_ERROR(kKSTErrorReplaceCleanupFailed, moveError, true,
                                   "Failed to remove replace file at %@", url));
      return false;
    }
    KST_CRASH_POINT("recovery.journal-retired");
  }
  return true;
}

}  // namespace kestrel
