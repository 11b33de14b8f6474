#include "platform/file_system.h"

#include <acl/libacl.h>
#include <attr/libattr.h>
#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/data_protection.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

struct FtsCloser {
  void operator()(FTS* fts) const { ::fts_close(fts); }
};
using FtsHandle = std::unique_ptr<FTS, FtsCloser>;

// The errno of a library call that reported failure, never 0.
int lastError() {
  return errno != 0 ? errno : EIO;
}

FtsHandle openWalk(const char* path, int options) {
  char* paths[] = {const_cast<char*>(path), nullptr};
  return FtsHandle(::fts_open(paths, options, nullptr));
}

// --- Removal -------------------------------------------------------------------------------

// The errno of removing one entry of the walk; 0 when it is gone or needs nothing yet.
int removeEntry(const FTSENT* entry) {
  switch (entry->fts_info) {
    case FTS_D:
      return 0;  // Removed after its contents (FTS_DP).
    case FTS_DP:
      return ::rmdir(entry->fts_accpath) == 0 ? 0 : errno;
    case FTS_DNR:
      // Its contents could not be listed; it goes only when it is empty.
      if (::rmdir(entry->fts_accpath) == 0) return 0;
      return entry->fts_errno != 0 ? entry->fts_errno : errno;
    case FTS_ERR:
    case FTS_NS:
      return entry->fts_errno != 0 ? entry->fts_errno : EIO;
    case FTS_DC:
      return ELOOP;
    default:  // Files, symbolic links (never followed) and special files.
      return ::unlink(entry->fts_accpath) == 0 ? 0 : errno;
  }
}

// Walks and removes one tree; `failures` counts the errors reported so far.
// A directory whose descendants were all removed and which is still not
// empty got new entries during the walk (death row gets arrivals while it is
// swept): it is walked again, at most `arrivalRetries` times deep.
int removeTree(const char* path, const TreeRemoveErrorCallback& onItemError, long& failures,
               int arrivalRetries) {
  struct stat st {};
  if (::lstat(path, &st) != 0) return errno;
  const FtsHandle walk = openWalk(path, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV);
  if (!walk) return lastError();
  errno = 0;
  while (FTSENT* entry = ::fts_read(walk.get())) {
    if (entry->fts_info == FTS_D) entry->fts_number = failures;
    int error = removeEntry(entry);
    if (error == ENOTEMPTY && entry->fts_info == FTS_DP && entry->fts_number == failures &&
        arrivalRetries > 0) {
      error = removeTree(entry->fts_accpath, onItemError, failures, arrivalRetries - 1);
      if (error == ENOENT) error = 0;
    }
    if (error != 0) {
      ++failures;
      if (!(onItemError && onItemError(entry->fts_path, error))) return error;
    }
    errno = 0;
  }
  return errno;
}

constexpr int kArrivalRetries = 4;

// Beyond this many directories deep, the removal goes on by paths (above), so
// that a pathological tree cannot exhaust the descriptors.
constexpr int kMaxDescriptorDepth = 128;

// Removes a tree relative to open directories, as `rm -rf` does: entries are
// listed with getdents64 and their type taken from it (no stat per file),
// files are unlinked by name in their open directory, and directories are
// opened without following links, checked to be on the tree's file system
// and emptied before they go. The same outcome as the walk above, item for
// item: the same errors reported, links never followed, other file systems
// not entered, arrivals during the removal removed too.
class DescriptorTreeRemover {
 public:
  DescriptorTreeRemover(const TreeRemoveErrorCallback& onItemError, long& failures)
      : onItemError_(onItemError), failures_(failures) {}

  // Removes the directory `path` (lstat'ed as `info`) with its contents.
  int removeTop(const char* path, const struct stat& info) {
    device_ = info.st_dev;
    path_ = path;
    return removeDirectory(AT_FDCWD, path, 0, true);
  }

 private:
  // Counts a failed item and asks the callback: 0 to go on, else the error to stop with.
  int report(int error) {
    ++failures_;
    return onItemError_ && onItemError_(path_.c_str(), error) ? 0 : error;
  }

  // Appends "/name" to path_ for the life of the object.
  class PathPart {
   public:
    PathPart(std::string& path, const char* name, bool top) : path_(path), mark_(path.size()) {
      if (!top) (path_ += '/') += name;
    }
    ~PathPart() { path_.resize(mark_); }
    PathPart(const PathPart&) = delete;
    PathPart& operator=(const PathPart&) = delete;

   private:
    std::string& path_;
    std::size_t mark_;
  };

  int removeDirectory(int parent, const char* name, int depth, bool top = false) {
    PathPart part(path_, name, top);
    if (depth > kMaxDescriptorDepth) {
      const int error = removeTree(path_.c_str(), onItemError_, failures_, kArrivalRetries);
      return error == ENOENT ? 0 : error;
    }
    const UniqueFd directory(
        ::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory) {
      const int openError = errno;
      if (openError == ENOENT) return 0;
      if (openError == ENOTDIR || openError == ELOOP) {
        // No directory (any more): path_ names the item already.
        if (::unlinkat(parent, name, 0) == 0 || errno == ENOENT) return 0;
        return report(errno);
      }
      // Its contents cannot be listed: it goes only when it is empty.
      if (::unlinkat(parent, name, AT_REMOVEDIR) == 0) return 0;
      return report(openError);
    }
    struct stat info {};
    if (::fstat(directory.get(), &info) != 0) return report(errno);
    // A file system mounted here is not entered; its mount point stays.
    const bool enter = info.st_dev == device_;
    const long failuresBefore = failures_;
    for (int retries = kArrivalRetries;; --retries) {
      if (enter) {
        if (const int error = removeContents(directory.get(), depth); error != 0) return error;
      }
      if (::unlinkat(parent, name, AT_REMOVEDIR) == 0 || errno == ENOENT) return 0;
      const int error = errno;
      // Emptied without a failure and still not empty: entries arrived meanwhile.
      if (error == ENOTEMPTY && enter && failures_ == failuresBefore && retries > 0 &&
          ::lseek(directory.get(), 0, SEEK_SET) == 0) {
        continue;
      }
      return report(error);
    }
  }

  // Reports a failure of the entry `name` of the directory being emptied.
  int reportEntry(const char* name, int error) {
    PathPart part(path_, name, false);
    return report(error);
  }

  int removeContents(int directory, int depth) {
    // The buffer's own storage: deeper levels may grow buffers_, which moves
    // the vectors but not what they hold.
    char* const buffer = bufferAt(depth).data();
    for (;;) {
      const long length = ::syscall(SYS_getdents64, directory, buffer, kListingBytes);
      if (length == 0) return 0;
      if (length < 0) {
        if (errno == EINTR) continue;
        return report(errno);
      }
      // Each record: inode (8 bytes), offset (8), record length (2), type (1), name.
      for (long offset = 0; offset < length;) {
        const char* record = buffer + offset;
        unsigned short recordLength = 0;
        std::memcpy(&recordLength, record + 16, sizeof recordLength);
        offset += recordLength;
        const auto type = static_cast<unsigned char>(record[18]);
        const char* name = record + 19;
        if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
        if (const int error = removeEntry(directory, name, type, depth); error != 0) return error;
      }
    }
  }

  int removeEntry(int directory, const char* name, unsigned char type, int depth) {
    if (type == DT_UNKNOWN) {
      struct stat info {};
      if (::fstatat(directory, name, &info, AT_SYMLINK_NOFOLLOW) != 0) {
        return errno == ENOENT ? 0 : reportEntry(name, errno);
      }
      type = S_ISDIR(info.st_mode) ? DT_DIR : DT_REG;
    }
    if (type != DT_DIR) {
      if (::unlinkat(directory, name, 0) == 0 || errno == ENOENT) return 0;
      // EISDIR: replaced by a directory since it was listed.
      if (errno != EISDIR) return reportEntry(name, errno);
    }
    return removeDirectory(directory, name, depth + 1);
  }

  std::vector<char>& bufferAt(int depth) {
    while (buffers_.size() <= static_cast<std::size_t>(depth)) buffers_.emplace_back(kListingBytes);
    return buffers_[static_cast<std::size_t>(depth)];
  }

  static constexpr std::size_t kListingBytes = 32 * 1024;

  const TreeRemoveErrorCallback& onItemError_;
  long& failures_;
  dev_t device_ = 0;
  std::string path_;
  std::vector<std::vector<char>> buffers_;
};

// --- Copy ----------------------------------------------------------------------------------

// Extended attributes to copy: all but those that the ACL copy carries
// (system.posix_acl_*), and but those /etc/xattr.conf says to skip, except
// that trusted.* attributes (protection classes, extended ACL entries) are
// always kept.
int keepAttribute(const char* name, struct error_context* context) {
  const int action = ::attr_copy_action(name, context);
  if (action == ATTR_ACTION_PERMISSIONS) return 0;
  if (std::strncmp(name, "trusted.", 8) == 0) return 1;
  return action == ATTR_ACTION_SKIP ? 0 : 1;
}

// attr_copy_action() reads its configuration on first use without a lock.
void loadAttributeActions() {
  static std::once_flag once;
  std::call_once(once, [] { ::attr_copy_action("user.", nullptr); });
}

std::string procPath(int fd) {
  return "/proc/self/fd/" + std::to_string(fd);
}

// Where an entry of the copy goes: a name in an open destination directory, or
// the destination path itself for the top entry.
struct Place {
  int directory = AT_FDCWD;
  const char* name = nullptr;

  // A path naming the same item without following a link at its last component.
  std::string path() const {
    return directory == AT_FDCWD ? std::string(name) : procPath(directory) + "/" + name;
  }
};

int copyData(int in, int out) {
  // In the kernel first (and sharing extents where the file system can).
  for (;;) {
    const ssize_t n = ::copy_file_range(in, nullptr, out, nullptr, std::size_t{1} << 30, 0);
    if (n > 0) continue;
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP) break;
    return errno;
  }
  // Both offsets have moved past what was copied; go on from there.
  std::vector<char> buffer(std::size_t{1} << 16);
  for (;;) {
    const ssize_t n = ::read(in, buffer.data(), buffer.size());
    if (n == 0) return 0;
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    for (ssize_t done = 0; done < n;) {
      const ssize_t w = ::write(out, buffer.data() + done, static_cast<std::size_t>(n - done));
      if (w < 0) {
        if (errno == EINTR) continue;
        return errno;
      }
      done += w;
    }
  }
}

class TreeCopy {
 public:
  TreeCopy(const char* from, const char* to) : from_(from), to_(to) {}

  int run() {
    loadAttributeActions();
    const FtsHandle walk = openWalk(from_, FTS_PHYSICAL | FTS_NOCHDIR);
    if (!walk) return lastError();
    errno = 0;
    while (FTSENT* entry = ::fts_read(walk.get())) {
      const int error = copyEntry(entry);
      if (error != 0) return error;
      errno = 0;
    }
    return errno;
  }

 private:
  Place placeOf(const FTSENT* entry) const {
    if (entry->fts_level == FTS_ROOTLEVEL) return Place{AT_FDCWD, to_};
    return Place{directories_[static_cast<std::size_t>(entry->fts_level) - 1].get(),
                 entry->fts_name};
  }

  int copyEntry(FTSENT* entry) {
    switch (entry->fts_info) {
      case FTS_D:
        return enterDirectory(entry);
      case FTS_DP:
        return leaveDirectory(entry);
      case FTS_F:
        return copyRegularFile(entry);
      case FTS_SL:
      case FTS_SLNONE:
        return copySymbolicLink(entry);
      case FTS_DEFAULT:
        return copySpecialFile(entry);
      case FTS_DC:
        return ELOOP;
      default:  // FTS_DNR, FTS_ERR, FTS_NS
        return entry->fts_errno != 0 ? entry->fts_errno : EIO;
    }
  }

  int enterDirectory(const FTSENT* entry) {
    const struct stat& st = *entry->fts_statp;
    if (madeRoot_ && st.st_dev == rootDevice_ && st.st_ino == rootInode_) return EINVAL;
    const Place place = placeOf(entry);
    // Owner-only until its contents are in; the source's mode comes last.
    if (::mkdirat(place.directory, place.name, S_IRWXU) != 0) return errno;
    UniqueFd directory(
        ::openat(place.directory, place.name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory) return errno;
    if (entry->fts_level == FTS_ROOTLEVEL) {
      struct stat made {};
      if (::fstat(directory.get(), &made) != 0) return errno;
      madeRoot_ = true;
      rootDevice_ = made.st_dev;
      rootInode_ = made.st_ino;
    }
    const auto level = static_cast<std::size_t>(entry->fts_level);
    if (directories_.size() <= level) directories_.resize(level + 1);
    directories_[level] = std::move(directory);
    return 0;
  }

  int leaveDirectory(const FTSENT* entry) {
    const auto level = static_cast<std::size_t>(entry->fts_level);
    const UniqueFd destination = std::move(directories_[level]);
    const UniqueFd source(
        ::open(entry->fts_accpath, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!source) return errno;
    struct stat st {};
    if (::fstat(source.get(), &st) != 0) return errno;
    if (::fchown(destination.get(), st.st_uid, st.st_gid) != 0) return errno;
    if (::attr_copy_fd(entry->fts_path, source.get(), to_, destination.get(), keepAttribute,
                       nullptr) != 0) {
      return lastError();
    }
    // Access and default ACLs; the default ACL can only be reached by path.
    if (::perm_copy_file(procPath(source.get()).c_str(), procPath(destination.get()).c_str(),
                         nullptr) != 0) {
      return lastError();
    }
    return finishWithModeAndTimes(destination.get(), st);
  }

  int copyRegularFile(const FTSENT* entry) {
    const UniqueFd source(
        ::open(entry->fts_accpath, O_RDONLY | O_NOFOLLOW | O_NOCTTY | O_NONBLOCK | O_CLOEXEC));
    if (!source) return errno;
    struct stat st {};
    if (::fstat(source.get(), &st) != 0) return errno;
    if (!S_ISREG(st.st_mode)) return EAGAIN;  // Replaced while we walked.
    const Place place = placeOf(entry);
    const UniqueFd destination(::openat(place.directory, place.name,
                                        O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                                        S_IRUSR | S_IWUSR));
    if (!destination) return errno;
    if (const int error = copyData(source.get(), destination.get()); error != 0) return error;
    if (::fchown(destination.get(), st.st_uid, st.st_gid) != 0) return errno;
    const std::string destinationPath = place.path();
    if (::attr_copy_fd(entry->fts_path, source.get(), destinationPath.c_str(), destination.get(),
                       keepAttribute, nullptr) != 0 ||
        ::perm_copy_fd(entry->fts_path, source.get(), destinationPath.c_str(), destination.get(),
                       nullptr) != 0) {
      return lastError();
    }
    return finishWithModeAndTimes(destination.get(), st);
  }

  int copySymbolicLink(const FTSENT* entry) {
    const struct stat& st = *entry->fts_statp;
    std::string target(static_cast<std::size_t>(st.st_size) + 1, '\0');
    for (;;) {
      const ssize_t n = ::readlink(entry->fts_accpath, target.data(), target.size());
      if (n < 0) return errno;
      if (static_cast<std::size_t>(n) < target.size()) {
        target.resize(static_cast<std::size_t>(n));
        break;
      }
      target.resize(target.size() * 2);  // The link grew since it was examined.
    }
    const Place place = placeOf(entry);
    if (::symlinkat(target.c_str(), place.directory, place.name) != 0) return errno;
    if (::fchownat(place.directory, place.name, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) {
      return errno;
    }
    if (::attr_copy_file(entry->fts_accpath, place.path().c_str(), keepAttribute, nullptr) != 0) {
      return lastError();
    }
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    return ::utimensat(place.directory, place.name, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
  }

  // FIFOs, sockets and device nodes: made anew, never opened.
  int copySpecialFile(const FTSENT* entry) {
    const struct stat& st = *entry->fts_statp;
    const Place place = placeOf(entry);
    if (::mknodat(place.directory, place.name, st.st_mode & (S_IFMT | 0700), st.st_rdev) != 0) {
      return errno;
    }
    if (::fchownat(place.directory, place.name, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) {
      return errno;
    }
    const std::string destinationPath = place.path();
    if (::attr_copy_file(entry->fts_accpath, destinationPath.c_str(), keepAttribute, nullptr) !=
            0 ||
        ::perm_copy_file(entry->fts_accpath, destinationPath.c_str(), nullptr) != 0) {
      return lastError();
    }
    if (::fchmodat(place.directory, place.name, st.st_mode & 07777, 0) != 0) return errno;
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    return ::utimensat(place.directory, place.name, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
  }

  // The mode last: changing the owner clears set-id bits, and a read-only
  // directory must stay writable until its contents are in.
  static int finishWithModeAndTimes(int fd, const struct stat& st) {
    if (::fchmod(fd, st.st_mode & 07777) != 0) return errno;
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    return ::futimens(fd, times) == 0 ? 0 : errno;
  }

  const char* from_;
  const char* to_;
  // The open destination directory of each level of the walk.
  std::vector<UniqueFd> directories_;
  bool madeRoot_ = false;
  dev_t rootDevice_ = 0;
  ino_t rootInode_ = 0;
};

// --- Whole files ---------------------------------------------------------------------------

int writeAll(int fd, std::span<const std::uint8_t> contents) {
  std::size_t done = 0;
  while (done < contents.size()) {
    const ssize_t n = ::write(fd, contents.data() + done, contents.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    done += static_cast<std::size_t>(n);
  }
  return 0;
}

int writeInPlace(const char* path, std::span<const std::uint8_t> contents,
                 const FileWriteOptions& options) {
  const UniqueFd fd(
      ::open(path, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, options.mode));
  if (!fd) return errno;
  if (const int error = writeAll(fd.get(), contents); error != 0) return error;
  if (options.protectionClass) {
    return setProtectionClassOfNewFile(fd.get(), *options.protectionClass);
  }
  return 0;
}

int writeAtomically(const char* path, std::span<const std::uint8_t> contents,
                    const FileWriteOptions& options) {
  const std::string target(path);
  const std::size_t slash = target.rfind('/');
  const std::string directory = slash == std::string::npos ? "." : target.substr(0, slash + 1);
  const std::string name = slash == std::string::npos ? target : target.substr(slash + 1);
  if (name.empty()) return EISDIR;
  // Hidden, so that directory listings never show a half-written file.
  std::string temporary = directory + "." + name + ".XXXXXX";
  const UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
  if (!fd) return errno;
  // Removes the temporary file unless it became the target.
  struct Remover {
    const std::string& path;
    bool armed = true;
    ~Remover() {
      if (armed) ::unlink(path.c_str());
    }
  } remover{temporary};

  if (::fchmod(fd.get(), options.mode) != 0) return errno;
  if (const int error = writeAll(fd.get(), contents); error != 0) return error;
  if (options.protectionClass) {
    if (const int error = setProtectionClassOfNewFile(fd.get(), *options.protectionClass);
        error != 0) {
      return error;
    }
  }
  if (::fsync(fd.get()) != 0) return errno;
  if (::rename(temporary.c_str(), path) != 0) return errno;
  remover.armed = false;
  // Make the rename itself durable; the new contents are in place either way.
  const UniqueFd parent(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (parent) ::fsync(parent.get());
  return 0;
}

}  // namespace

int treeRemove(const char* path, const TreeRemoveErrorCallback& onItemError) {
  long failures = 0;
  struct stat info {};
  if (::lstat(path, &info) != 0) return errno;
  if (!S_ISDIR(info.st_mode)) return removeTree(path, onItemError, failures, kArrivalRetries);
  DescriptorTreeRemover remover(onItemError, failures);
  const int error = remover.removeTop(path, info);
  return error == ENOENT ? 0 : error;
}

int makePath(const char* path, mode_t mode) {
  std::string target(path);
  while (target.size() > 1 && target.back() == '/') target.pop_back();
  if (target.empty()) return ENOENT;
  if (::mkdir(target.c_str(), mode) == 0) return 0;
  if (errno != ENOENT) return errno;
  // A parent is missing: make every component from the top.
  for (std::size_t slash = target.find('/', 1); slash != std::string::npos;
       slash = target.find('/', slash + 1)) {
    if (target[slash - 1] == '/') continue;
    const std::string parent = target.substr(0, slash);
    if (::mkdir(parent.c_str(), mode) == 0) continue;
    if (errno != EEXIST) return errno;
    struct stat st {};
    if (::stat(parent.c_str(), &st) != 0) return errno;
    if (!S_ISDIR(st.st_mode)) return ENOTDIR;
  }
  return ::mkdir(target.c_str(), mode) == 0 ? 0 : errno;
}

int copyTree(const char* from, const char* to) {
  struct stat st {};
  if (::lstat(from, &st) != 0) return errno;
  return TreeCopy(from, to).run();
}

int lstatFileFlags(const char* path, std::uint32_t* flags) {
  struct statx sx {};
  if (::statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, 0, &sx) != 0) return errno;
  *flags = 0;
  const auto has = [&sx](std::uint64_t attribute) {
    return (sx.stx_attributes_mask & attribute) != 0 && (sx.stx_attributes & attribute) != 0;
  };
  if (has(STATX_ATTR_IMMUTABLE)) *flags |= kFileFlagUserImmutable;
  if (has(STATX_ATTR_APPEND)) *flags |= kFileFlagAppend;
  return 0;
}

int lchflags(const char* path, std::uint32_t flags) {
  if ((flags & ~kFileFlagsPreventingRemoval) != 0) return EOPNOTSUPP;
  struct stat st {};
  if (::lstat(path, &st) != 0) return errno;
  // Opening a device or a FIFO could have effects of its own; links carry no flags.
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return EOPNOTSUPP;
  const UniqueFd fd(::open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) return errno;
  int attributes = 0;
  if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &attributes) != 0) return errno;
  int wanted = attributes & ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
  if ((flags & kFileFlagUserImmutable) != 0) wanted |= FS_IMMUTABLE_FL;
  if ((flags & kFileFlagAppend) != 0) wanted |= FS_APPEND_FL;
  if (wanted == attributes) return 0;
  return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &wanted) == 0 ? 0 : errno;
}

int readWholeFile(const char* path, std::size_t maxSize, std::vector<std::uint8_t>* contents) {
  contents->clear();
  const UniqueFd fd(::open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) return errno;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return errno;
  if (S_ISDIR(st.st_mode)) return EISDIR;
  if (!S_ISREG(st.st_mode)) return EINVAL;
  if (static_cast<std::uint64_t>(st.st_size) > maxSize) return EFBIG;
  contents->reserve(static_cast<std::size_t>(st.st_size));
  // Uncached: the pages are read once, so they go to the end of the kernel's
  // reclaim order instead of pushing other files' pages out. They are not
  // dropped after the read: a cache rebuild that follows a restart would then
  // read every metadata file from the disk again.
  ::posix_fadvise(fd.get(), 0, 0, POSIX_FADV_NOREUSE);
  std::uint8_t buffer[1 << 14];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n == 0) break;
    if (n < 0) {
      if (errno == EINTR) continue;
      const int error = errno;
      contents->clear();
      return error;
    }
    if (contents->size() + static_cast<std::size_t>(n) > maxSize) {
      contents->clear();
      return EFBIG;
    }
    contents->insert(contents->end(), buffer, buffer + n);
    // All the bytes the file had when it was opened, read by a short read: its
    // end (a file written in place would be replaced, never grown), without
    // one more read to see it.
    if (static_cast<std::size_t>(n) < sizeof buffer &&
        contents->size() == static_cast<std::size_t>(st.st_size)) {
      break;
    }
  }
  return 0;
}

int writeFile(const char* path, std::span<const std::uint8_t> contents,
              const FileWriteOptions& options) {
  return options.atomic ? writeAtomically(path, contents, options)
                        : writeInPlace(path, contents, options);
}

}  // namespace kestrel::platform
