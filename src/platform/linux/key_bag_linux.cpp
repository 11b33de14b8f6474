#include "platform/linux/key_bag_linux.h"

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <systemd/sd-login.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

constexpr const char* kStateDirectory = "/run/kestrel";
constexpr std::string_view kLockStateName = "lock-state";
constexpr const char* kMultiUserFile = "/etc/kestrel/multi-user";
constexpr std::string_view kLogindSource = "logind";
// Session uids below this belong to system accounts, not to people.
constexpr uid_t kFirstHumanUid = 501;
constexpr std::string_view kWhitespace = " \t\r\n\v\f";

struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};

std::string errorText(int error) {
  return std::generic_category().message(error);
}

// Reads a whole file; 0 or the errno of the failure.
int readFile(const std::string& path, std::string* contents) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) return errno;
  contents->clear();
  char buffer[4096];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (n == 0) return 0;
    contents->append(buffer, static_cast<std::size_t>(n));
  }
}

bool exists(const std::string& path) {
  struct stat st {};
  return ::lstat(path.c_str(), &st) == 0;
}

// mkdir -p with a fixed mode for every directory made; 0 or an errno.
int makeDirectories(const std::string& path, mode_t mode) {
  for (std::size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    const std::string prefix = path.substr(0, slash);
    if (::mkdir(prefix.c_str(), mode) == 0) {
      // The umask must not narrow what others may read here.
      if (::chmod(prefix.c_str(), mode) != 0) return errno;
    } else if (errno != EEXIST) {
      return errno;
    }
    if (slash == std::string::npos) break;
  }
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return errno;
  return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}

// Reads every queued inotify event; true when one of them concerns the lock-state
// file (or the kernel dropped events, so it may have).
bool drainEvents(int fd) {
  bool relevant = false;
  alignas(inotify_event) char buffer[4096];
  for (;;) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return relevant;
    for (ssize_t offset = 0; offset < n;) {
      inotify_event event;
      std::memcpy(&event, buffer + offset, sizeof event);
      if ((event.mask & IN_Q_OVERFLOW) != 0) relevant = true;
      if (event.len > 0) {
        const char* name = buffer + offset + sizeof(inotify_event);
        if (std::string_view(name, ::strnlen(name, event.len)) == kLockStateName) relevant = true;
      }
      offset += static_cast<ssize_t>(sizeof(inotify_event) + event.len);
    }
  }
}

}  // namespace

// One registration: the inotify descriptor and the source reading it. The source
// is declared last so it is destroyed (and its handler finished) before the
// descriptor closes.
struct LinuxKeyBag::Watch {
  explicit Watch(int fd) : inotify(fd) {}

  UniqueFd inotify;
  std::unique_ptr<ReadSource> source;
};

int parseLockState(std::string_view content) {
  const auto first = content.find_first_not_of(kWhitespace);
  if (first == std::string_view::npos) return -1;
  content = content.substr(first, content.find_last_not_of(kWhitespace) - first + 1);
  int value = 0;
  const auto [end, ec] = std::from_chars(content.data(), content.data() + content.size(), value);
  if (ec != std::errc() || end != content.data() + content.size()) return -1;
  return value;
}

LinuxKeyBag::LinuxKeyBag(FilesystemRoot root)
    : root_(std::move(root)), stateWatch_(root_.resolve(kStateDirectory), root_.resolve("/")) {}

LinuxKeyBag::~LinuxKeyBag() = default;

int LinuxKeyBag::lockState() {
  const std::lock_guard lock(stateMutex_);
  if (stateWatched_ && !stateWatch_.changed()) return cachedState_;
  // Watch first: a change made while the file is read is seen next time.
  stateWatched_ = stateWatch_.arm();
  cachedState_ = readLockState();
  return cachedState_;
}

int LinuxKeyBag::readLockState() const {
  std::string content;
  const int rc =
      readFile(root_.resolve(kStateDirectory) + "/" + std::string(kLockStateName), &content);
  if (rc == ENOENT) return kUnlocked;
  if (rc != 0) return -1;
  return parseLockState(content);
}

int LinuxKeyBag::registerLockStatusNotification(std::shared_ptr<DispatchQueue> queue,
                                                Work handler) {
  if (!queue || !handler) return EINVAL;
  const std::string directory = root_.resolve(kStateDirectory);
  if (const int rc = makeDirectories(directory, 0755); rc != 0) return rc;

  auto watch = std::make_unique<Watch>(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!watch->inotify.valid()) return errno;
  if (::inotify_add_watch(watch->inotify.get(), directory.c_str(),
                          IN_CLOSE_WRITE | IN_MOVED_TO | IN_CREATE | IN_DELETE | IN_MODIFY) < 0) {
    return errno;
  }
  const int fd = watch->inotify.get();
  watch->source = ReadSource::create(fd, std::move(queue), [fd, handler = std::move(handler)] {
    if (drainEvents(fd)) handler();
  });
  if (!watch->source) return EAGAIN;
  watch->source->resume();

  std::lock_guard lock(mutex_);
  watches_.push_back(std::move(watch));
  return 0;
}

std::optional<UserTypeInfo> LinuxKeyBag::userTypeInfo() {
  UserTypeInfo info;
  info.deviceMode =
      exists(root_.resolve(kMultiUserFile)) ? DeviceMode::MultiUser : DeviceMode::SingleUser;
  return info;
}

std::optional<std::vector<std::uint32_t>> LinuxKeyBag::userSessionIds(std::string* error) {
  const auto fail = [error](std::string text) -> std::optional<std::vector<std::uint32_t>> {
    if (error != nullptr) *error = std::move(text);
    return std::nullopt;
  };
  const std::string path = root_.resolve(kMultiUserFile);
  std::string content;
  if (const int rc = readFile(path, &content); rc != 0) {
    if (rc == ENOENT) return fail(path + " does not exist: the device is not in multi-user mode");
    return fail(path + ": " + errorText(rc));
  }

  std::string_view rest = content;
  const auto first = rest.find_first_not_of(kWhitespace);
  const auto last = rest.find_last_not_of(kWhitespace);
  if (first != std::string_view::npos && rest.substr(first, last - first + 1) == kLogindSource) {
    uid_t* raw = nullptr;
    const int count = ::sd_get_uids(&raw);
    const std::unique_ptr<uid_t, FreeDeleter> uids(raw);
    if (count < 0) return fail("logind: " + errorText(-count));
    std::vector<std::uint32_t> ids;
    for (int i = 0; i < count; ++i) {
      if (uids.get()[i] >= kFirstHumanUid) ids.push_back(uids.get()[i]);
    }
    return ids;
  }

  std::vector<std::uint32_t> ids;
  while (true) {
    const auto start = rest.find_first_not_of(kWhitespace);
    if (start == std::string_view::npos) break;
    rest.remove_prefix(start);
    const std::string_view token = rest.substr(0, rest.find_first_of(kWhitespace));
    rest.remove_prefix(token.size());
    std::uint32_t uid = 0;
    const auto [end, ec] = std::from_chars(token.data(), token.data() + token.size(), uid);
    if (ec != std::errc() || end != token.data() + token.size()) {
      return fail(path + ": \"" + std::string(token) + "\" is not a user id");
    }
    ids.push_back(uid);
  }
  return ids;
}

}  // namespace kestrel::platform
