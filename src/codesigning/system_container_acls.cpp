// The access-control-list templates of system containers and the
// KSTFileManager operations that set them on a path, a container tree and
// every container of a class directory.
#include "codesigning/system_container_acls.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <system_error>

#include "daemon/log.h"
#include "platform/services.h"
#include "store/file_manager.h"

namespace kestrel {

static_assert(kKSTSystemContainerDirectoryPermissions == 16382);
static_assert(kKSTSystemContainerFilePermissions == 16318);
static_assert(kKSTSystemContainerTopLevelPermissions == 1572);
static_assert(kKSTSystemContainerTopLevelInheritFlags == 352);
static_assert(kKSTSystemContainerDirectoryFlags == 96);
static_assert(kKSTSystemContainerFileFlags == 16);

namespace {

constexpr const char* kMetadataFileName = ".com.zorvane.kestrel.metadata.plist";

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

// The installed ACL service; none only in a process that never installed one.
platform::ExtendedACL* aclService() {
  return platform::services().extendedACL.get();
}

bool fail(KSTErrorRef* error, KSTErrorRef made) {
  KSTSetError(error, std::move(made));
  return false;
}

}  // namespace

bool KSTLookupGroupUUID(std::string_view groupName, platform::Uuid* uuid, KSTErrorRef* error) {
  platform::ExtendedACL* service = aclService();
  const int looked = service != nullptr ? service->lookupGroupUUID(groupName, uuid) : ENOSYS;
  if (looked != 0) {
    return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                 "Failed to look up the membership UUID of group %s: %s", groupName,
                                 errnoText(looked)));
  }
  return true;
}

bool KSTFileManager::_createSystemUserACEInACL(platform::AccessControlList* acl,
                                               std::uint32_t withPermissions,
                                               std::uint32_t andFlags, KSTErrorRef* error) const {
  platform::ExtendedACL* service = aclService();
  platform::ACLEntryIndex entry = 0;
  if (const int e = service != nullptr ? service->createEntry(acl, &entry) : ENOSYS; e != 0) {
    return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true, "acl_create_entry() failed: %s",
                                 errnoText(e)));
  }
  platform::Uuid nameUUID;
  if (!KSTLookupGroupUUID(kKSTSystemUsersGroupName, &nameUUID, error)) return false;

  if (withPermissions != 0) {
    std::uint32_t permset = 0;
    if (const int e = service->getPermset(*acl, entry, &permset); e != 0) {
      return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                   "acl_get_permset() failed: %s", errnoText(e)));
    }
    if (const int e = service->addPerm(&permset, withPermissions); e != 0) {
      return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                   "acl_add_perm() failed to set perms %x: %s", withPermissions,
                                   errnoText(e)));
    }
    if (const int e = service->setPermset(acl, entry, permset); e != 0) {
      return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                   "acl_set_permset() failed: %s", errnoText(e)));
    }
  }
  if (andFlags != 0) {
    std::uint32_t flagset = 0;
    if (const int e = service->getFlagset(*acl, entry, &flagset); e != 0) {
      return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                   "acl_get_flagset_np() failed: %s", errnoText(e)));
    }
    if (const int e = service->addFlag(&flagset, andFlags); e != 0) {
      return fail(
          error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                           "acl_add_flag_np() failed to set flags %x: %s", andFlags, errnoText(e)));
    }
    if (const int e = service->setFlagset(acl, entry, flagset); e != 0) {
      return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                   "acl_set_flagset_np() failed: %s", errnoText(e)));
    }
  }
  if (const int e = service->setTagType(acl, entry, platform::kACLTagExtendedAllow); e != 0) {
    return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true, "acl_set_tag_type() failed: %s",
                                 errnoText(e)));
  }
  if (const int e = service->setQualifier(acl, entry, nameUUID); e != 0) {
    return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true,
                                 "acl_set_qualifier() failed: %s", errnoText(e)));
  }
  return true;
}

std::optional<platform::AccessControlList> KSTFileManager::_copySystemContainerACLWithNumACEs(
    int numACEs, bool isDir, bool inheritOnly, KSTErrorRef* error) const {
  platform::ExtendedACL* service = aclService();
  platform::AccessControlList acl;
  if (const int e = service != nullptr ? service->init(numACEs, &acl) : ENOSYS; e != 0) {
    fail(error,
         KST_ERROR(kKSTErrorACLFailed, nullptr, true, "acl_init() failed: %s", errnoText(e)));
    return std::nullopt;
  }
  const std::uint32_t permissions =
      isDir ? kKSTSystemContainerDirectoryPermissions : kKSTSystemContainerFilePermissions;
  const std::uint32_t flags = !isDir        ? kKSTSystemContainerFileFlags
                              : inheritOnly ? kKSTSystemContainerTopLevelInheritFlags
                                            : kKSTSystemContainerDirectoryFlags;
  if (!_createSystemUserACEInACL(&acl, permissions, flags, error)) return std::nullopt;
  return acl;
}

std::optional<platform::AccessControlList> KSTFileManager::_copyTopLevelSystemContainerACL(
    KSTErrorRef* error) const {
  std::optional<platform::AccessControlList> acl =
      _copySystemContainerACLWithNumACEs(2, true, true, error);
  if (!acl) return std::nullopt;
  if (!_createSystemUserACEInACL(&*acl, kKSTSystemContainerTopLevelPermissions, 0, error)) {
    return std::nullopt;
  }
  return acl;
}

bool KSTFileManager::setTopLevelSystemContainerACLAtURL(const KSTFileURL& url,
                                                        KSTErrorRef* error) const {
  const std::optional<platform::AccessControlList> acl = _copyTopLevelSystemContainerACL(error);
  if (!acl) return false;
  const int set =
      aclService()->setFile(url.fileSystemRepresentation(), platform::kACLTypeExtended, *acl);
  if (set != 0) {
    return fail(error, KST_ERROR(kKSTErrorACLFailed, nullptr, true, "Failed to set ACL on %@: %s",
                                 url, errnoText(set)));
  }
  return true;
}

bool KSTFileManager::standardizeACLsAtURL(const KSTFileURL& url, bool isSystemContainer,
                                          KSTErrorRef* error) const {
  const std::optional<platform::AccessControlList> topLevelACL =
      _copyTopLevelSystemContainerACL(error);
  if (!topLevelACL) return false;
  const std::optional<platform::AccessControlList> directoryACL =
      _copySystemContainerACLWithNumACEs(1, true, false, error);
  if (!directoryACL) return false;
  const std::optional<platform::AccessControlList> fileACL =
      _copySystemContainerACLWithNumACEs(1, false, false, error);
  if (!fileACL) return false;

  platform::ExtendedACL& service = *aclService();
  return _traverseDirectory(url, error, [&](FTSENT* entry, KSTErrorRef*) {
    // A directory is done on its first visit; the second, after its contents,
    // has nothing left to do.
    if (entry->fts_info == FTS_DP) return true;
    const char* path = entry->fts_path;
    if (std::strstr(path, kMetadataFileName) != nullptr) return true;
    const mode_t mode = entry->fts_statp->st_mode;
    // A symbolic link carries no list and no mode of its own here, and is
    // never followed to what it names.
    if (S_ISLNK(mode)) return true;
    const bool isTopLevel = isSystemContainer && entry->fts_level == FTS_ROOTLEVEL;

    if (S_ISDIR(mode)) {
      if (isTopLevel) {
        if (const int e = service.setFile(path, platform::kACLTypeExtended, *topLevelACL); e != 0) {
          KSTLogTag(kLogError, "standardizeACLsAtURL", "Failed to set top level ACL on dir %s: %s",
                    path, errnoText(e));
        }
      } else if (const int e = service.setFile(path, platform::kACLTypeExtended, *directoryACL);
                 e != 0) {
        KSTLogTag(kLogError, "standardizeACLsAtURL", "Failed to set ACL on dir %s: %s", path,
                  errnoText(e));
      }
    } else if (const int e = service.setFile(path, platform::kACLTypeExtended, *fileACL); e != 0) {
      KSTLogTag(kLogError, "standardizeACLsAtURL", "Failed to set ACL on dir %s: %s", path,
                errnoText(e));
    }
    // The top directory of a system container keeps its mode and owner.
    if (isTopLevel) return true;

    if (const int e = service.setModeKeepingACL(path, 0); e != 0) {
      KSTLogTag(kLogError, "standardizeACLsAtURL", "Could not chmod %s: %s", path, errnoText(e));
    }
    if (::lchown(path, kKSTSystemContainerItemOwner, kKSTSystemContainerItemGroup) != 0) {
      KSTLogTag(kLogError, "standardizeACLsAtURL", "Could not chown %s: %s", path,
                errnoText(errno));
    }
    return true;
  });
}

bool KSTFileManager::standardizeACLsForSystemContainerAtURL(const KSTFileURL& url,
                                                            KSTErrorRef* error) const {
  return standardizeACLsAtURL(url, true, error);
}

bool KSTFileManager::standardizeAllSystemContainerACLsAtURL(const KSTFileURL& url,
                                                            KSTErrorRef* error) const {
  KSTErrorRef listError;
  const std::optional<std::vector<KSTFileURL>> items =
      urlsForItemsInDirectoryAtURL(url, &listError);
  if (!items) {
    if (listError != nullptr && listError->isPOSIXError(ENOENT)) return true;
    KSTLog(kLogError, "Failed to get items at URL%@ : %@", url, listError);
    return fail(error, std::move(listError));
  }
  if (items->empty()) return true;

  PlistArray paths;
  paths.reserve(items->size());
  for (const KSTFileURL& item : *items) paths.emplace_back(item.path());
  KSTLog(kLogNotice, "Potential containers requiring ACL migration: %@", PlistValue(paths));

  bool allSucceeded = true;
  KSTErrorRef lastError;
  for (const KSTFileURL& item : *items) {
    KSTErrorRef itemError;
    if (!standardizeACLsForSystemContainerAtURL(item, &itemError)) {
      KSTLog(kLogError, "Failed to set system container ACL at %@: %@", item, itemError);
      allSucceeded = false;
      lastError = std::move(itemError);
    }
  }
  if (!allSucceeded) return fail(error, std::move(lastError));
  return true;
}

}  // namespace kestrel
