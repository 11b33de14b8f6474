// Create or look up: the one way a caller gets the container of an
// identifier. A new container is built whole in the staging directory
// (directory, metadata file, ACL, default sub-directories) and enters its
// class directory by one rename, so a class directory never holds a
// half-built container: a crash leaves either nothing there or a complete
// container, and at most a directory in staging.
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "codesigning/whitelist.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "platform/crash_point.h"
#include "platform/uuid.h"
#include "store/container_cache.h"
#include "store/container_identifier.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

constexpr mode_t kContainerDirectoryMode = 0755;
// The operation whose errors the builder's steps and the body's lambda build.
constexpr const char* kCreateOrLookup = "createOrLookupContainerForUser";
// The sub-directories of system containers belong to nobody (-2, as user and
// group) and are closed by their mode; their ACL opens them to the system user.
constexpr uid_t kSystemItemOwner = 4294967294u;

const std::vector<std::string_view>& subDirectoryNames(KSTContainerClass containerClass) {
  static const std::vector<std::string_view> data = {"Documents", "Library", "Library/Caches",
                                                     "Library/Preferences", "tmp"};
  static const std::vector<std::string_view> group = {"Library", "Library/Caches"};
  static const std::vector<std::string_view> none;
  switch (containerClass) {
    case kKSTContainerClassDataApplication:
    case kKSTContainerClassDataVantlerPlugin:
    case kKSTContainerClassDataVPNPlugin:
    case kKSTContainerClassDataVexelService:
    case kKSTContainerClassDataInternalDaemon:
    case kKSTContainerClassDataTempDir:
    case kKSTContainerClassDataSystem:
      return data;
    case kKSTContainerClassSharedAppGroup:
    case kKSTContainerClassSharedSystemGroup:
      return group;
    default:
      return none;
  }
}

}  // namespace

bool KSTClientConnection::_createDefaultDirectory(const KSTFileURL& url, mode_t mode, uid_t owner,
                                                  KSTErrorRef* error) {
  return KSTFileManager::defaultManager().createDirectoryAtURL(url, true, mode, owner, error);
}

bool KSTClientConnection::_createTopLevelContainerDirectory(const KSTFileURL& url,
                                                            KSTContainerClass containerClass,
                                                            uid_t owner, KSTErrorRef* error) {
  if (KSTIsBundleClass(containerClass)) {
    owner = kKSTInstallerUserId;
  } else if (KSTIsSystemClass(containerClass)) {
    owner = kKSTRootUserId;
  }
  return KSTFileManager::defaultManager().createDirectoryAtURL(url, true, kContainerDirectoryMode,
                                                               owner, KSTProtectionClass{0}, error);
}

bool KSTClientConnection::_createSubDirectories(const KSTFileURL& url, std::uint32_t userId,
                                                KSTContainerClass containerClass,
                                                KSTErrorRef* error) {
  mode_t mode = kContainerDirectoryMode;
  uid_t owner = userId;
  if (KSTIsBundleClass(containerClass)) {
    owner = kKSTInstallerUserId;
  } else if (KSTIsSystemClass(containerClass)) {
    mode = 0;
    owner = kSystemItemOwner;
  }
  for (std::string_view name : subDirectoryNames(containerClass)) {
    KSTErrorRef makeError;
    if (_createDefaultDirectory(url.appending(name, true), mode, owner, &makeError)) continue;
    KSTSetError(error, KST_ERROR(kKSTErrorCreateSubdirectoryFailed, makeError, true,
                                 "Failed to create sub-dir at %@%@", url.path() + "/", name));
    return false;
  }
  return true;
}

namespace {

// Steps of a creation that run while the caller's lock is held. The staging
// URL is kept by the caller so that it can still be retired after an
// exception.
class ContainerBuilder {
 public:
  ContainerBuilder(KSTClientConnection& client, std::uint32_t userId, const std::string& identifier,
                   KSTContainerClass containerClass, bool transient)
      : client_(client),
        userId_(userId),
        identifier_(identifier),
        containerClass_(containerClass),
        transient_(transient) {}

  // Builds the container in staging and renames it into place; on failure
  // before it is in place, retires the staging directory to death row.
  KSTMetadataRef build(std::optional<KSTFileURL>* staging, KSTErrorRef* error) {
    const std::string directoryName = platform::Uuid::random().string();
    *staging =
        KSTGlobalConfiguration::sharedInstance().stagingDirectory().appending(directoryName, true);
    KSTMetadataRef record = buildInStaging(**staging, error);
    if (record && !synchronizeStaging(**staging, error)) record = nullptr;
    std::optional<KSTFileURL> destination;
    if (record) destination = moveIntoPlace(**staging, directoryName, error);
    if (!destination) {
      *error = retireStaging(client_, **staging, *error);
      return nullptr;
    }
    // In place; what the cache and the caller are told must survive a power
    // loss, so the class directory (and any directory made above it) is
    // flushed before either hears of it.
    KSTErrorRef syncError;
    const bool durable = KSTFileManager::defaultManager().synchronizeDirectoryAndAncestorsAtURL(
        destination->deletingLastPathComponent(), &syncError);
    KSTMetadataRef added = addToCache(record, *destination, error);
    if (added && !durable) {
      // Left in place and known to the cache, like any container: asking
      // again finds it.
      *error =
          KST_ERROR_IN(kCreateOrLookup, kKSTErrorMoveStagingFailed, syncError, true,
                       "Failed to move staging dir: %@ to live dir: %@", **staging, *destination);
      return nullptr;
    }
    return added;
  }

  // Clean-up: the staging directory goes to death row; one that was never
  // made counts as moved. The step's own error stands unless the move fails.
  static KSTErrorRef retireStaging(KSTClientConnection& client, const KSTFileURL& staging,
                                   KSTErrorRef stepError) {
    KSTErrorRef moveError;
    if (client._moveItemAtURLToDeathRow(staging, true, true, &moveError)) return stepError;
    return KST_ERROR_IN(kCreateOrLookup, kKSTErrorRemoveStagingFailed, moveError, true,
                        "Failed to remove staging dir: %@", staging);
  }

 private:
  KSTMetadataRef buildInStaging(const KSTFileURL& staging, KSTErrorRef* error) {
    KSTErrorRef stepError;
    if (!client_._createTopLevelContainerDirectory(staging, containerClass_, userId_, &stepError)) {
      *error = KST_ERROR_IN(kCreateOrLookup, kKSTErrorCreateStagingFailed, stepError, true,
                            "Failed to create staging dir at %@ : %@", staging, stepError);
      return nullptr;
    }
    KSTMetadataRef record = KSTMetadata::initWithUserId(
        userId_, platform::Uuid::random(), containerClass_, identifier_, std::nullopt, staging);
    if (!record->writeMetadataToDiskWithError(error)) return nullptr;
    KST_CRASH_POINT("create.metadata-written");

    const KSTFileManager& fileManager = KSTFileManager::defaultManager();
    const bool isSystem = KSTIsSystemClass(containerClass_);
    if (isSystem && !fileManager.setTopLevelSystemContainerACLAtURL(staging, error)) return nullptr;
    if (!client_._createSubDirectories(staging, userId_, containerClass_, error)) return nullptr;
    // The sub-directories are made with mode 000, which also closes what the
    // top directory's inherited ACL would grant them; giving each its own list
    // opens them to the system user again.
    if (isSystem && !fileManager.standardizeACLsForSystemContainerAtURL(staging, error)) {
      return nullptr;
    }
    return record;
  }

  // The whole new container reaches the disk before the rename that makes it
  // live: its sub-directories, owners, modes and ACLs (its metadata file was
  // flushed when it was written).
  static bool synchronizeStaging(const KSTFileURL& staging, KSTErrorRef* error) {
    KSTErrorRef syncError;
    if (KSTFileManager::defaultManager().synchronizeTreeAtURL(staging, &syncError)) return true;
    *error = KST_ERROR_IN(kCreateOrLookup, kKSTErrorCreateStagingFailed, syncError, true,
                          "Failed to create staging dir at %@ : %@", staging, syncError);
    return false;
  }

  std::optional<KSTFileURL> moveIntoPlace(const KSTFileURL& staging,
                                          const std::string& directoryName, KSTErrorRef* error) {
    const std::optional<KSTFileURL> classDirectory =
        KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            userId_, containerClass_, transient_);
    std::optional<std::string> wellknownName;
    const KSTWhitelist& whitelist = KSTWhitelist::sharedWhitelist();
    if (containerClass_ == kKSTContainerClassSharedSystemGroup) {
      wellknownName = whitelist.wellknownSystemGroupContainerForId(identifier_);
    } else if (containerClass_ == kKSTContainerClassDataSystem) {
      wellknownName = whitelist.wellknownSystemContainerForId(identifier_);
    }

    KSTErrorRef moveError;
    if (classDirectory) {
      KSTFileURL destination =
          classDirectory->appending(wellknownName.value_or(directoryName), true);
      if (KSTFileManager::defaultManager().moveItemAtURL(staging, destination, &moveError)) {
        KST_CRASH_POINT("create.in-place");
        return destination;
      }
      *error = KST_ERROR_IN(kCreateOrLookup, kKSTErrorMoveStagingFailed, moveError, true,
                            "Failed to move staging dir: %@ to live dir: %@", staging, destination);
      return std::nullopt;
    }
    *error = KST_ERROR_IN(kCreateOrLookup, kKSTErrorMoveStagingFailed, moveError, true,
                          "Failed to move staging dir: %@ to live dir: %@", staging, nullptr);
    return std::nullopt;
  }

  KSTMetadataRef addToCache(const KSTMetadataRef& record, const KSTFileURL& destination,
                            KSTErrorRef* error) {
    record->setUrl(destination);
    record->setExisted(false);
    record->setTransient(transient_);
    KSTErrorRef cacheError;
    if (KSTContainerCache::sharedInstance().addContainerMetadata(record, userId_, destination,
                                                                 transient_, &cacheError)) {
      KST_CRASH_POINT("create.cached");
      return record;
    }
    // The container is complete and stays; the next rebuild of the class map finds it.
    *error = KST_ERROR_IN(kCreateOrLookup, kKSTErrorCacheAddFailed, cacheError, true,
                          "Failed to add to cache for %u : %@, url: %@, transient: %d", userId_,
                          record, destination, transient_ ? 1 : 0);
    return nullptr;
  }

  KSTClientConnection& client_;
  const std::uint32_t userId_;
  const std::string& identifier_;
  const KSTContainerClass containerClass_;
  const bool transient_;
};

}  // namespace

KSTMetadataRef KSTClientConnection::createOrLookupContainerForUser(
    std::uint32_t userId, const std::optional<std::string>& identifier, bool createIfNecessary,
    KSTContainerClass containerClass, bool transient, bool useLocking, std::uint64_t* withError) {
  if (!identifier || !KSTIdentifierIsUsable(*identifier) ||
      !KSTIsValidContainerClass(containerClass)) {
    KSTHandOverCode(KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                              "Can't act on an invalid object: userId: %u, ID: %@, class: %ld",
                              userId, KSTIdentifierForLog(identifier), containerClass),
                    withError);
    return nullptr;
  }
  if (!KSTUserIdIsValidForClass(containerClass, userId)) {
    KSTHandOverCode(
        KST_ERROR(kKSTErrorInvalidObject, nullptr, true, "Invalid userId %u for class %ld, ID: %@",
                  userId, containerClass, *identifier),
        withError);
    return nullptr;
  }
  if (containerClass == kKSTContainerClassDataSystem && !allowOtherIdLookup_ &&
      !KSTCodeSigningMapping::sharedInstance().identifierHasSystemContainer(*identifier)) {
    KSTHandOverCode(KST_ERROR(kKSTErrorNotEntitled, nullptr, true,
                              "%@ not entitled for a system container, but %@ is trying",
                              *identifier, clientBundleIdentifier_),
                    withError);
    return nullptr;
  }

  std::optional<KSTFileURL> staging;
  KSTErrorRef failure;
  std::uint64_t exceptionCode = kKSTSuccess;
  KSTMetadataRef result = KST_CATCH_EXCEPTIONS(&exceptionCode, nullptr, [&]() -> KSTMetadataRef {
    std::optional<KSTAllIdentifiersLockGuard> lock;
    if (useLocking) lock.emplace(kKSTLockForWriting);

    KSTContainerCache& cache = KSTContainerCache::sharedInstance();
    KSTErrorRef cacheError;
    KSTMetadataRef found =
        cache.containerForUser(userId, containerClass, *identifier, transient, &cacheError);
    if (found && !transient) {
      found->setExisted(true);
      return found;
    }
    if (found) {
      // A transient container is handed out fresh every time: the old one goes.
      KSTErrorRef moveError;
      if (!_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
        failure = KST_ERROR_IN(kCreateOrLookup, kKSTErrorRemoveTransientFailed, moveError, true,
                               "Failed to remove transient container at %@", found->url());
        return nullptr;
      }
      KST_CRASH_POINT("create.transient-retired");
      // Without this the entry would outlive its directory, and every later
      // lookup of the identifier would fail as inconsistent.
      cache.removeContainerForUser(userId, containerClass, *identifier, transient, nullptr);
    } else if (!cacheError || cacheError->domain() != kKSTErrorDomain ||
               cacheError->code() != kKSTErrorNotFound) {
      failure = std::move(cacheError);
      return nullptr;
    }

    if (!createIfNecessary) {
      failure = KST_ERROR_IN(kCreateOrLookup, kKSTErrorNotFound, nullptr, false,
                             "Container with identifier: \"%@\" Not Found", *identifier);
      return nullptr;
    }
    ContainerBuilder builder(*this, userId, *identifier, containerClass, transient);
    return builder.build(&staging, &failure);
  });

  if (exceptionCode != kKSTSuccess) {
    // The builder may have been stopped half-way: what it made goes too.
    if (staging) ContainerBuilder::retireStaging(*this, *staging, nullptr);
    KSTSetCode(withError, exceptionCode);
    return nullptr;
  }
  if (!result) KSTHandOverCode(failure, withError);
  return result;
}

}  // namespace kestrel
