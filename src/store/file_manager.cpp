#include "store/file_manager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <system_error>

#include "daemon/log.h"
#include "platform/data_protection.h"
#include "platform/file_system.h"
#include "platform/services.h"
#include "platform/unique_fd.h"

namespace kestrel {

namespace {

namespace fs = std::filesystem;

constexpr const char* kMetadataFileName = ".com.zorvane.kestrel.metadata.plist";
// Physical walk, no change of working directory, no other file systems.
constexpr int kWalkOptions = FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV;

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

struct FtsCloser {
  void operator()(FTS* fts) const { ::fts_close(fts); }
};
using FtsHandle = std::unique_ptr<FTS, FtsCloser>;

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};
using DirHandle = std::unique_ptr<DIR, DirCloser>;

FtsHandle openWalk(const char* path) {
  char* paths[] = {const_cast<char*>(path), nullptr};
  return FtsHandle(::fts_open(paths, kWalkOptions, nullptr));
}

// What a removal keeps between items: the first error reported, ENOENT included.
struct TreeRemoveContext {
  int errorNumber = 0;
};

constexpr const char* kTreeRemoveCallbackTag = "_treeremove_error_callback";

// Clears the flags that keep an item (or a directory's entries) from going.
// True when it had some and they are gone.
bool clearFlagsPreventingRemoval(const char* path) {
  std::uint32_t flags = 0;
  if (const int statError = platform::lstatFileFlags(path, &flags); statError != 0) {
    KSTLogTag(kLogError, kTreeRemoveCallbackTag,
              "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path, errnoText(statError));
    return false;
  }
  if ((flags & platform::kFileFlagsPreventingRemoval) == 0) return false;
  if (const int flagError =
          platform::lchflags(path, flags & ~platform::kFileFlagsPreventingRemoval);
      flagError != 0) {
    KSTLogTag(kLogError, kTreeRemoveCallbackTag, "Failed to lchflags %s: %s", path,
              errnoText(flagError));
    return false;
  }
  KSTLogTag(kLogNotice, kTreeRemoveCallbackTag, "Unset UF_IMMUTABLE on %s", path);
  return true;
}

// Removes one item that the walk could not; an immutable directory is left
// empty by then, or fails here.
bool removeAgain(const char* path) {
  if (::unlink(path) == 0 || (errno == EISDIR && ::rmdir(path) == 0)) return true;
  KSTLogTag(kLogError, kTreeRemoveCallbackTag, "unlink of %s failed: %s", path, errnoText(errno));
  return false;
}

// Called for each item that a removal could not remove. An item kept by its
// own immutable or append-only flag, or by its directory's, loses the flag
// and is removed here; every other failure is logged and the first one kept.
// The removal always goes on.
bool _treeremove_error_callback(const char* path, int reportedError, TreeRemoveContext* context) {
  int error = reportedError;
  if (error == 0) {
    KSTLogTag(kLogError, kTreeRemoveCallbackTag,
              "treeremove hit error for %s but we failed to get the error number", path);
    error = ENOENT;
  }
  if (error != ENOENT) {
    KSTLogTag(kLogError, kTreeRemoveCallbackTag, "treeremove hit error for %s : %s", path,
              errnoText(error));
    if (error == EPERM) {
      if (clearFlagsPreventingRemoval(path)) {
        if (removeAgain(path)) return true;
      } else if (const std::string parent = fs::path(path).parent_path().string();
                 !parent.empty() && clearFlagsPreventingRemoval(parent.c_str())) {
        if (removeAgain(path)) return true;
      }
    }
  }
  if (context != nullptr && context->errorNumber == 0) context->errorNumber = error;
  return true;
}

// Owner, group and mode of one item of a tree whose ownership is standardised.
void standardizeItem(const char* path, const struct stat& st, uid_t uid, gid_t gid,
                     bool compareGroup) {
  if (std::strstr(path, kMetadataFileName) != nullptr) return;
  if (st.st_uid != uid || (compareGroup && st.st_gid != gid)) {
    if (::lchown(path, uid, gid) != 0) {
      KSTLogTag(kLogError, "standardizeOwnershipAtURL", "Could not chown %s: %s", path,
                errnoText(errno));
    }
  }
  // A symbolic link has no mode of its own on Linux.
  if (S_ISLNK(st.st_mode)) return;
  const mode_t mode = (S_ISDIR(st.st_mode) || (st.st_mode & 0111) != 0) ? 0755 : 0644;
  if (::fchmodat(AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW) != 0) {
    KSTLogTag(kLogError, "standardizeOwnershipAtURL", "Could not chmod %s: %s", path,
              errnoText(errno));
  }
}

// Where a missing source counts as success (copy/move "if exists"): whether
// it is there. A failed lstat is an error named after the calling operation.
enum class SourceState { Present, Missing, Failed };
SourceState sourceState(const char* function, int line, const KSTFileURL& url, KSTErrorRef* error) {
  struct stat st {};
  if (::lstat(url.fileSystemRepresentation(), &st) == 0) return SourceState::Present;
  const int statError = errno;
  if (statError == ENOENT) return SourceState::Missing;
  KSTSetError(error, KSTCreatePOSIXError(function, line, statError, "stat of %@ failed: %s", url,
                                         errnoText(statError)));
  return SourceState::Failed;
}

}  // namespace

KSTFileManager& KSTFileManager::defaultManager() {
  static KSTFileManager manager;
  return manager;
}

bool KSTFileManager::removeItemAtURL(const KSTFileURL& url, KSTErrorRef* error) const {
  if (url.empty()) {
    KSTSetError(error, KST_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  TreeRemoveContext context;
  const int removed =
      platform::treeRemove(url.fileSystemRepresentation(), [&context](const char* item, int e) {
        return _treeremove_error_callback(item, e, &context);
      });
  if (removed != 0 && removed != ENOENT) {
    KSTSetError(error,
                KST_POSIX_ERROR(removed, "treeremove of %@ failed: %s", url, errnoText(removed)));
    return false;
  }
  if (context.errorNumber != 0 && context.errorNumber != ENOENT) {
    KSTSetError(error, KST_POSIX_ERROR(context.errorNumber, "treeremove of %@ failed: %s", url,
                                       errnoText(context.errorNumber)));
    return false;
  }
  return true;
}

bool KSTFileManager::createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories,
                                          mode_t mode, uid_t owner,
                                          KSTProtectionClass protectionClass,
                                          KSTErrorRef* error) const {
  const char* path = url.fileSystemRepresentation();
  if (withIntermediateDirectories) {
    const int made = platform::makePath(path, mode);
    if (made != 0 && made != EEXIST) {
      KSTSetError(error, KST_POSIX_ERROR(made, "makepath of %s failed: %s", path, errnoText(made)));
      return false;
    }
  } else if (::mkdir(path, mode) != 0 && errno != EEXIST) {
    const int made = errno;
    KSTSetError(error, KST_POSIX_ERROR(made, "mkdir of %s failed: %s", path, errnoText(made)));
    return false;
  }
  if (protectionClass != kKSTProtectionClassLeaveAlone) {
    const platform::UniqueFd directory(
        ::open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory) {
      const int opened = errno;
      KSTSetError(error,
                  KST_POSIX_ERROR(opened, "opendir of %s failed: %s", path, errnoText(opened)));
      return false;
    }
    const auto number = static_cast<std::int32_t>(protectionClass);
    if (const int set = platform::setProtectionClass(directory.get(), number); set != 0) {
      KSTSetError(error, KST_POSIX_ERROR(set, "Failed to setclass(%d) on directory %s: %s", number,
                                         path, errnoText(set)));
      return false;
    }
  }
  if (owner != kKSTOwnerLeaveAlone) {
    // Not checked: a directory with the wrong owner is still a directory.
    [[maybe_unused]] const int changed = ::lchown(path, owner, owner);
  }
  return true;
}

bool KSTFileManager::createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories,
                                          mode_t mode, uid_t owner, KSTErrorRef* error) const {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner,
                              kKSTProtectionClassLeaveAlone, error);
}

bool KSTFileManager::createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories,
                                          mode_t mode, KSTProtectionClass protectionClass,
                                          KSTErrorRef* error) const {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, kKSTOwnerLeaveAlone,
                              protectionClass, error);
}

bool KSTFileManager::createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories,
                                          mode_t mode, KSTErrorRef* error) const {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, kKSTOwnerLeaveAlone,
                              kKSTProtectionClassLeaveAlone, error);
}

bool KSTFileManager::_copyItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                    bool failIfSrcMissing, KSTErrorRef* error) const {
  if (!failIfSrcMissing) {
    const SourceState source = sourceState(__func__, __LINE__, url, error);
    if (source != SourceState::Present) return source == SourceState::Missing;
  }
  const int copied =
      platform::copyTree(url.fileSystemRepresentation(), toURL.fileSystemRepresentation());
  if (copied != 0) {
    KSTSetError(error, KST_POSIX_ERROR(copied, "copytree of %@ to %@ failed: %s", url, toURL,
                                       errnoText(copied)));
    return false;
  }
  return true;
}

bool KSTFileManager::copyItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                   KSTErrorRef* error) const {
  return _copyItemAtURL(url, toURL, true, error);
}

bool KSTFileManager::copyItemIfExistsAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                           KSTErrorRef* error) const {
  return _copyItemAtURL(url, toURL, false, error);
}

bool KSTFileManager::_moveItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                    bool failIfSrcMissing, KSTErrorRef* error) const {
  if (!failIfSrcMissing) {
    const SourceState source = sourceState(__func__, __LINE__, url, error);
    if (source != SourceState::Present) return source == SourceState::Missing;
  }
  if (::rename(url.fileSystemRepresentation(), toURL.fileSystemRepresentation()) == 0) return true;
  const int renameError = errno;
  if (renameError == EXDEV) return moveAcrossFileSystems(url, toURL, error);
  KSTSetError(error, KST_POSIX_ERROR(renameError, "rename of %@ to %@ failed: %s", url, toURL,
                                     errnoText(renameError)));
  return false;
}

bool KSTFileManager::moveAcrossFileSystems(const KSTFileURL& url, const KSTFileURL& toURL,
                                           KSTErrorRef* error) const {
  // Like the rename it stands for, a failed move leaves nothing at the
  // destination: a copy that failed half-way, or whose source could not be
  // removed, is taken away again. (Of a source that was partly removed, the
  // part that went is gone: such moves carry items on their way out.)
  const bool destinationWasFree = itemDoesNotExistAtURL(toURL);
  const auto removeCopy = [&] {
    if (destinationWasFree) removeItemAtURL(toURL, nullptr);
  };
  if (!_copyItemAtURL(url, toURL, true, error)) {
    removeCopy();
    return false;
  }
  KSTErrorRef removeError;
  if (removeItemAtURL(url, &removeError)) return true;
  KSTLogTag(kLogError, "_moveItemAtURL", "Failed to remove source %@ : %s", url,
            errnoText(static_cast<int>(removeError->code())));
  removeCopy();
  KSTSetError(error, std::move(removeError));
  return false;
}

bool KSTFileManager::moveItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                   KSTErrorRef* error) const {
  return _moveItemAtURL(url, toURL, true, error);
}

bool KSTFileManager::moveItemIfExistsAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                                           KSTErrorRef* error) const {
  return _moveItemAtURL(url, toURL, false, error);
}

std::optional<KSTFileURL> KSTFileManager::createTemporaryDirectoryInDirectoryURL(
    const KSTFileURL& url, uid_t owner, KSTErrorRef* error) const {
  KSTSetError(error, nullptr);
  const std::string pattern = url.appending("temp.XXXXXX").path();
  std::string path = pattern;
  if (::mkdtemp(path.data()) == nullptr) {
    const int made = errno;
    KSTSetError(error, KST_POSIX_ERROR(made, "Failed to create temp dir at path %s : %s", pattern,
                                       errnoText(made)));
    return std::nullopt;
  }
  if (owner != kKSTOwnerLeaveAlone) {
    // Not checked, as for new directories.
    [[maybe_unused]] const int changed = ::lchown(path.c_str(), owner, owner);
  }
  return KSTFileURL(std::move(path), true);
}

std::optional<KSTFileURL> KSTFileManager::createTemporaryDirectoryInDirectoryURL(
    const KSTFileURL& url, KSTErrorRef* error) const {
  return createTemporaryDirectoryInDirectoryURL(url, kKSTOwnerLeaveAlone, error);
}

bool KSTFileManager::_traverseDirectory(const KSTFileURL& url, KSTErrorRef* error,
                                        const KSTTraversalVisitor& withBlock) const {
  const char* path = url.fileSystemRepresentation();
  FtsHandle walk = openWalk(path);
  if (!walk) {
    const int opened = errno;
    KSTSetError(error, KST_POSIX_ERROR(opened, "fts_open failed for %s with error %s", path,
                                       errnoText(opened)));
    return false;
  }
  bool visitedAll = true;
  KSTErrorRef failure;
  errno = 0;
  for (;;) {
    FTSENT* entry = ::fts_read(walk.get());
    if (entry == nullptr) {
      // The end, or a walk that could not go on.
      if (errno != 0) {
        visitedAll = false;
        failure = KST_POSIX_ERROR(errno, "Error for path %s: %s", path, errnoText(errno));
      }
      break;
    }
    if (entry->fts_info == FTS_ERR || entry->fts_info == FTS_NS) {
      visitedAll = false;
      failure = KST_POSIX_ERROR(entry->fts_errno, "Error for path %s: %s", path,
                                errnoText(entry->fts_errno));
      break;
    }
    KSTErrorRef visitorError;
    if (!withBlock(entry, &visitorError)) {
      visitedAll = false;
      failure = std::move(visitorError);
      break;
    }
    errno = 0;
  }
  if (::fts_close(walk.release()) != 0 && failure == nullptr) {
    const int closed = errno;
    visitedAll = false;
    failure =
        KST_POSIX_ERROR(closed, "fts_close failed for %s with error %s", path, errnoText(closed));
  }
  if (!visitedAll) KSTSetError(error, std::move(failure));
  return visitedAll;
}

std::optional<std::vector<KSTFileURL>> KSTFileManager::urlsForItemsInDirectoryAtURL(
    const KSTFileURL& url, KSTErrorRef* error) const {
  const std::string& path = url.path();
  std::vector<KSTFileURL> urls;
  int failure = 0;
  platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  DirHandle directory(fd ? ::fdopendir(fd.get()) : nullptr);
  if (!directory) {
    failure = errno;
    if (failure != ENOENT) {
      KSTLogTag(kLogError, "_IterateDirectory", "opendir of %s failed: %s", path,
                errnoText(failure));
    }
  } else {
    fd.release();  // The directory stream owns it now.
    for (;;) {
      errno = 0;
      const struct dirent* entry = ::readdir(directory.get());
      if (entry == nullptr) {
        failure = errno;
        break;
      }
      if (entry->d_name[0] == '.') continue;
      bool isDirectory = entry->d_type == DT_DIR;
      if (entry->d_type == DT_UNKNOWN) {
        const std::string itemPath = path + "/" + entry->d_name;
        struct stat st {};
        isDirectory = ::lstat(itemPath.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
      }
      urls.push_back(url.appending(entry->d_name, isDirectory));
    }
  }
  if (failure != 0) {
    KSTSetError(error, KST_POSIX_ERROR(failure, "_IterateDirectory for %@ returned %s", url,
                                       errnoText(failure)));
    return std::nullopt;
  }
  return urls;
}

bool KSTFileManager::itemExistsAtURL(const KSTFileURL& url) const {
  struct stat st {};
  if (::lstat(url.fileSystemRepresentation(), &st) == 0) return true;
  const int statError = errno;
  if (statError != ENOENT) {
    KSTLog(kLogError, "Failed to determine if %@ exists: %s", url, errnoText(statError));
  }
  return false;
}

bool KSTFileManager::itemDoesNotExistAtURL(const KSTFileURL& url) const {
  struct stat st {};
  if (::lstat(url.fileSystemRepresentation(), &st) == 0) return false;
  const int statError = errno;
  if (statError == ENOENT) return true;
  KSTLog(kLogError, "Failed to determine if %@ exists: %s", url, errnoText(statError));
  return false;
}

namespace {

// 0, or the errno of flushing the directory at path.
int synchronizeDirectory(const char* path) {
  const platform::UniqueFd directory(::open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!directory) return errno;
  return ::fsync(directory.get()) == 0 ? 0 : errno;
}

}  // namespace

bool KSTFileManager::synchronizeTreeAtURL(const KSTFileURL& url, KSTErrorRef* error) const {
  return _traverseDirectory(url, error, [](FTSENT* entry, KSTErrorRef* visitorError) {
    // A directory's second visit comes after everything beneath it.
    if (entry->fts_info != FTS_DP) return true;
    if (const int synced = synchronizeDirectory(entry->fts_accpath); synced != 0) {
      KSTSetError(visitorError,
                  KST_POSIX_ERROR_IN("synchronizeTreeAtURL", synced, "fsync of %s failed: %s",
                                     entry->fts_path, errnoText(synced)));
      return false;
    }
    return true;
  });
}

bool KSTFileManager::synchronizeDirectoryAndAncestorsAtURL(const KSTFileURL& url,
                                                           KSTErrorRef* error) const {
  const fs::path root = platform::services().root.path();
  for (fs::path directory = url.path();
       !directory.empty() && directory != root && directory != directory.root_path();
       directory = directory.parent_path()) {
    if (const int synced = synchronizeDirectory(directory.c_str()); synced != 0) {
      KSTSetError(error, KST_POSIX_ERROR(synced, "fsync of %s failed: %s", directory.string(),
                                         errnoText(synced)));
      return false;
    }
  }
  return true;
}

bool KSTFileManager::standardizeOwnershipAtURL(const KSTFileURL& url, uid_t toUID, gid_t GID,
                                               KSTErrorRef* error) const {
  const bool traversed = _traverseDirectory(url, error, [toUID, GID](FTSENT* entry, KSTErrorRef*) {
    switch (entry->fts_info) {
      case FTS_D:
      case FTS_DNR:
      case FTS_F:
      case FTS_SL:
      case FTS_SLNONE:
      case FTS_DEFAULT:
        standardizeItem(entry->fts_path, *entry->fts_statp, toUID, GID, true);
        break;
      default:  // A directory's second visit, or an entry without status.
        break;
    }
    return true;
  });
  const char* path = url.fileSystemRepresentation();
  struct stat st {};
  if (::lstat(path, &st) != 0) {
    const int statError = errno;
    KSTSetError(error,
                KST_POSIX_ERROR(statError, "Could not stat %s: %s", path, errnoText(statError)));
    return false;
  }
  standardizeItem(path, st, toUID, GID, false);
  return traversed;
}

void KSTFileManager::printDirectoryStructureAtURL(const KSTFileURL& url) const {
  const FtsHandle walk = openWalk(url.fileSystemRepresentation());
  if (!walk) {
    KSTLog(kLogError, "fts_open failed for %@ : %s", url, errnoText(errno));
    return;
  }
  while (const FTSENT* entry = ::fts_read(walk.get())) {
    switch (entry->fts_info) {
      case FTS_DP:
        break;
      case FTS_D:
      case FTS_F:
      case FTS_SL:
      case FTS_SLNONE:
      case FTS_DEFAULT:
        KSTLog(kLogError, "\tOrphaned File: %s", entry->fts_path);
        break;
      default:
        KSTLog(kLogError, "FTS returned error for %s : %s", entry->fts_path,
               errnoText(entry->fts_errno));
        break;
    }
  }
}

}  // namespace kestrel
