// The access-control-list templates of system containers and the
// KSTFileManager operations that set them on a path, a container tree and
// every container of a class directory.
#include "codesigning/system_container_acls.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <string>
#include <system_error>

#include "daemon/log.h"
#include "platform/services.h"
#include "platform/unique_fd.h"
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

namespace {

constexpr const char* kStandardizeTag = "standardizeACLsAtURL";
// Deeper than this a tree is not walked on (every level holds a directory open).
constexpr int kMaxStandardizeDepth = 256;

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};

// The three lists of a tree and where they go, applied item by item through
// descriptors: the walk never resolves a path beneath its starting item.
class TreeStandardizer {
 public:
  TreeStandardizer(platform::ExtendedACL& service, const platform::AccessControlList& topLevel,
                   const platform::AccessControlList& directory,
                   const platform::AccessControlList& file, bool isSystemContainer)
      : service_(service),
        topLevel_(topLevel),
        directory_(directory),
        file_(file),
        isSystemContainer_(isSystemContainer) {}

  // Walks the item `name` of the directory parentFd; false (with the walk's
  // error) only when the item itself cannot be opened.
  bool run(int parentFd, const std::string& name, const std::string& path, KSTErrorRef* error) {
    platform::UniqueFd item(::openat(parentFd, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat st {};
    if (!item || ::fstat(item.get(), &st) != 0) {
      const int opened = errno;
      KSTSetError(
          error, KST_POSIX_ERROR_IN(kStandardizeTag, opened, "fts_open failed for %s with error %s",
                                    path, errnoText(opened)));
      return false;
    }
    device_ = st.st_dev;
    visit(item, st, name, path, 0);
    return true;
  }

 private:
  void visit(const platform::UniqueFd& item, const struct stat& st, const std::string& name,
             const std::string& path, int level) {
    // The metadata file, or anything beneath an item of its name, is left alone.
    if (name.find(kMetadataFileName) != std::string::npos) return;
    // A symbolic link carries no list and no mode of its own here, and is
    // never followed to what it names.
    if (S_ISLNK(st.st_mode)) return;
    const bool isTopLevel = isSystemContainer_ && level == 0;
    const bool isDirectory = S_ISDIR(st.st_mode);
    const platform::AccessControlList& acl =
        isDirectory ? (isTopLevel ? topLevel_ : directory_) : file_;
    if (const int e = service_.setDescriptor(item.get(), platform::kACLTypeExtended, acl); e != 0) {
      KSTLogTag(kLogError, kStandardizeTag,
                isTopLevel ? "Failed to set top level ACL on dir %s: %s"
                           : "Failed to set ACL on dir %s: %s",
                path, errnoText(e));
    }
    // The top directory of a system container keeps its mode and owner.
    if (!isTopLevel) {
      if (const int e = service_.setModeKeepingACLDescriptor(item.get(), 0); e != 0) {
        KSTLogTag(kLogError, kStandardizeTag, "Could not chmod %s: %s", path, errnoText(e));
      }
      if (::fchownat(item.get(), "", kKSTSystemContainerItemOwner, kKSTSystemContainerItemGroup,
                     AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW) != 0) {
        KSTLogTag(kLogError, kStandardizeTag, "Could not chown %s: %s", path, errnoText(errno));
      }
    }
    // Another file system is not entered.
    if (isDirectory && st.st_dev == device_) visitChildren(item, path, level);
  }

  void visitChildren(const platform::UniqueFd& item, const std::string& path, int level) {
    if (level >= kMaxStandardizeDepth) {
      KSTLogTag(kLogError, kStandardizeTag, "Error for path %s: %s", path, errnoText(ELOOP));
      return;
    }
    const int listed = ::openat(item.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    std::unique_ptr<DIR, DirCloser> directory(listed >= 0 ? ::fdopendir(listed) : nullptr);
    if (!directory) {
      if (listed >= 0) ::close(listed);
      KSTLogTag(kLogError, kStandardizeTag, "Error for path %s: %s", path, errnoText(errno));
      return;
    }
    const int dirFd = ::dirfd(directory.get());
    while (const struct dirent* entry = ::readdir(directory.get())) {
      const std::string child = entry->d_name;
      if (child == "." || child == "..") continue;
      const std::string childPath = path + "/" + child;
      platform::UniqueFd childItem(::openat(dirFd, child.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
      struct stat childSt {};
      if (!childItem || ::fstat(childItem.get(), &childSt) != 0) {
        // Gone meanwhile: nothing left to standardize.
        if (errno != ENOENT) {
          KSTLogTag(kLogError, kStandardizeTag, "Error for path %s: %s", childPath,
                    errnoText(errno));
        }
        continue;
      }
      visit(childItem, childSt, child, childPath, level + 1);
    }
  }

  platform::ExtendedACL& service_;
  const platform::AccessControlList& topLevel_;
  const platform::AccessControlList& directory_;
  const platform::AccessControlList& file_;
  const bool isSystemContainer_;
  dev_t device_ = 0;
};

}  // namespace

bool KSTFileManager::standardizeACLsBeneath(int parentFd, const std::string& name,
                                            bool isSystemContainer, const std::string& displayPath,
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
  TreeStandardizer walk(*aclService(), *topLevelACL, *directoryACL, *fileACL, isSystemContainer);
  return walk.run(parentFd, name, displayPath, error);
}

bool KSTFileManager::standardizeACLsAtURL(const KSTFileURL& url, bool isSystemContainer,
                                          KSTErrorRef* error) const {
  // Only the item's own directory is looked up by path; the walk beneath it
  // goes by descriptors.
  const KSTFileURL parent = url.deletingLastPathComponent();
  const platform::UniqueFd parentFd(
      ::open(parent.fileSystemRepresentation(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!parentFd) {
    const int opened = errno;
    return fail(error, KST_POSIX_ERROR(opened, "fts_open failed for %s with error %s", url.path(),
                                       errnoText(opened)));
  }
  return standardizeACLsBeneath(parentFd.get(), url.lastPathComponent(), isSystemContainer,
                                url.path(), error);
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
