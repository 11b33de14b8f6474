#include "platform/linux/open_beneath_linux.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/file_system.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// Whether openat2 answered ENOSYS once: it will not start working later.
std::atomic<bool> openat2Refused{false};

// The mount of an open descriptor: its mount id where the kernel gives one,
// else its device (which cannot tell bind mounts of one file system apart).
bool mountOf(int fd, std::uint64_t* mount, bool* byMountId) {
  struct statx status {};
  if (::statx(fd, "", AT_EMPTY_PATH, STATX_MNT_ID, &status) != 0) return false;
  *byMountId = (status.stx_mask & STATX_MNT_ID) != 0;
  *mount = *byMountId
               ? status.stx_mnt_id
               : (static_cast<std::uint64_t>(status.stx_dev_major) << 32) | status.stx_dev_minor;
  return true;
}

// ENOTDIR from an open without following links says a link when name is one.
int linkAsLoop(int error, int directoryFd, const char* name) {
  struct stat status {};
  if (error == ENOTDIR && ::fstatat(directoryFd, name, &status, AT_SYMLINK_NOFOLLOW) == 0 &&
      S_ISLNK(status.st_mode)) {
    return ELOOP;
  }
  return error;
}

}  // namespace

int openBeneathWithOpenat2(int baseFd, const char* relativePath, int flags, int* fd) {
  open_how how{};
  how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV;
  const char* path = relativePath != nullptr && *relativePath != '\0' ? relativePath : ".";
  for (;;) {
    const long opened = ::syscall(SYS_openat2, baseFd, path, &how, sizeof how);
    if (opened >= 0) {
      *fd = static_cast<int>(opened);
      return 0;
    }
    // A rename elsewhere on the system may make the kernel ask for a retry.
    if (errno != EAGAIN && errno != EINTR) return errno;
  }
}

int openBeneathByNames(int baseFd, const char* relativePath, int flags, int* fd) {
  std::uint64_t baseMount = 0;
  bool byMountId = false;
  if (!mountOf(baseFd, &baseMount, &byMountId)) return errno;
  const auto onBaseMount = [&](int opened) {
    std::uint64_t mount = 0;
    bool sameKind = false;
    return mountOf(opened, &mount, &sameKind) && sameKind == byMountId && mount == baseMount;
  };
  UniqueFd current(::fcntl(baseFd, F_DUPFD_CLOEXEC, 0));
  if (!current) return errno;

  const std::string_view path = relativePath != nullptr ? relativePath : "";
  std::string last = ".";
  std::size_t start = 0;
  while (start <= path.size()) {
    std::size_t slash = path.find('/', start);
    if (slash == std::string_view::npos) slash = path.size();
    const std::string name(path.substr(start, slash - start));
    start = slash + 1;
    if (name.empty() || name == ".") continue;
    if (name == "..") return EXDEV;
    if (last != ".") {
      // The name before this one is a directory on the way: step into it.
      UniqueFd next(
          ::openat(current.get(), last.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!next) return linkAsLoop(errno, current.get(), last.c_str());
      if (!onBaseMount(next.get())) return EXDEV;
      current = std::move(next);
    }
    last = name;
  }
  UniqueFd opened(::openat(current.get(), last.c_str(), flags | O_NOFOLLOW | O_CLOEXEC));
  if (!opened) return linkAsLoop(errno, current.get(), last.c_str());
  if (!onBaseMount(opened.get())) return EXDEV;
  *fd = opened.release();
  return 0;
}

int openBeneath(int baseFd, const char* relativePath, int flags, int* fd) {
  if (!openat2Refused.load(std::memory_order_relaxed)) {
    const int error = openBeneathWithOpenat2(baseFd, relativePath, flags, fd);
    if (error != ENOSYS) return error;
    openat2Refused.store(true, std::memory_order_relaxed);
  }
  return openBeneathByNames(baseFd, relativePath, flags, fd);
}

}  // namespace kestrel::platform
