// The protection class of one file or directory, read and changed on a
// descriptor of the item itself, so that a symbolic link put in its place is
// never followed and the class lands on what was checked.
#include <fcntl.h>

#include <cerrno>
#include <optional>
#include <system_error>

#include "platform/data_protection.h"
#include "platform/unique_fd.h"
#include "store/file_manager.h"

namespace kestrel {

namespace {

// O_NONBLOCK: an item swapped for a FIFO after it was looked at must not
// hold the walk in open().
constexpr int kItemOpenFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

platform::UniqueFd openItem(const char* function, const KSTFileURL& url, KSTErrorRef* error) {
  platform::UniqueFd fd(::open(url.fileSystemRepresentation(), kItemOpenFlags));
  if (!fd) {
    const int opened = errno;
    KSTSetError(error, KST_POSIX_ERROR_IN(function, opened, "Failed to open %s : %s",
                                          url.fileSystemRepresentation(), errnoText(opened)));
  }
  return fd;
}

bool readClass(const char* function, int fd, const KSTFileURL& url,
               KSTProtectionClass* protectionClass, KSTErrorRef* error) {
  std::optional<std::int32_t> recorded;
  if (const int got = platform::getProtectionClass(fd, &recorded); got != 0) {
    KSTSetError(error, KST_POSIX_ERROR_IN(function, got, "Failed to getclass of file %s: %s",
                                          url.fileSystemRepresentation(), errnoText(got)));
    return false;
  }
  *protectionClass = recorded ? KSTProtectionClass{*recorded} : kKSTProtectionClassUnrecorded;
  return true;
}

}  // namespace

bool KSTFileManager::dataProtectionClassOfItemAtURL(const KSTFileURL& url,
                                                    KSTProtectionClass* protectionClass,
                                                    KSTErrorRef* error) const {
  const platform::UniqueFd fd = openItem(__func__, url, error);
  return fd && readClass(__func__, fd.get(), url, protectionClass, error);
}

bool KSTFileManager::setDataProtectionClassOfItemAtURL(
    const KSTFileURL& url, KSTProtectionClass toClass,
    const std::function<bool(KSTProtectionClass current)>& ifPredicate, KSTErrorRef* error) const {
  const platform::UniqueFd fd = openItem(__func__, url, error);
  if (!fd) return false;
  if (ifPredicate) {
    KSTProtectionClass current{};
    if (!readClass(__func__, fd.get(), url, &current, error)) return false;
    if (!ifPredicate(current)) return true;
  }
  const auto number = static_cast<std::int32_t>(toClass);
  if (const int set = platform::setProtectionClass(fd.get(), number); set != 0) {
    KSTSetError(error, KST_POSIX_ERROR(set, "Failed to setclass(%d) on file %s: %s", number,
                                       url.fileSystemRepresentation(), errnoText(set)));
    return false;
  }
  return true;
}

}  // namespace kestrel
