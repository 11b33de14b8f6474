#include "platform/linux/code_signing_identity_linux.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <map>
#include <optional>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/plist_serialization.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

constexpr const char* kSignaturesDirectory = "/etc/kestrel/signatures";
constexpr std::string_view kRegistrySuffix = ".plist";
constexpr const char* kSigningIdentifierKey = "SigningIdentifier";
constexpr const char* kEntitlementsKey = "Entitlements";
constexpr const char* kLabelKey = "Label";
constexpr const char* kExecutableKey = "Executable";
// A registry file is a few hundred bytes; anything this large is not one.
constexpr off_t kMaximumRegistryFileSize = 1 << 20;
constexpr int kMaximumNestingDepth = 64;

std::string errorText(int error) {
  return std::generic_category().message(error);
}

// ---------------------------------------------------------------------------
// Reading registry files: the daemon's guarded parser, which refuses what
// libplist would choke on (NUL bytes in strings, cycles, absurd nesting or
// object counts) before it gets there.

// Entitlements are shallow; a deeper file is refused rather than followed.
bool fitsNestingDepth(const PlistValue& value, int depth) {
  if (depth > kMaximumNestingDepth) return false;
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& item : *array) {
      if (!fitsNestingDepth(item, depth + 1)) return false;
    }
  } else if (const PlistDictionary* dictionary = value.dictionary()) {
    for (const auto& [key, item] : *dictionary) {
      if (!fitsNestingDepth(item, depth + 1)) return false;
    }
  }
  return true;
}

std::optional<PlistValue> parseRegistryFile(const std::string& bytes) {
  if (bytes.empty()) return std::nullopt;
  const auto* begin = reinterpret_cast<const std::uint8_t*>(bytes.data());
  std::optional<PlistValue> value = parsePropertyList(std::span(begin, bytes.size()), nullptr);
  if (value && !fitsNestingDepth(*value, 0)) return std::nullopt;
  return value;
}

// ---------------------------------------------------------------------------
// Trust of files.

// What a stat told about a file, enough to notice that it changed.
struct FileStamp {
  dev_t device = 0;
  ino_t inode = 0;
  uid_t owner = 0;
  mode_t mode = 0;
  off_t size = 0;
  timespec modified{};
  timespec changed{};

  static FileStamp of(const struct stat& st) {
    return FileStamp{st.st_dev,  st.st_ino,  st.st_uid, st.st_mode,
                     st.st_size, st.st_mtim, st.st_ctim};
  }
  bool operator==(const FileStamp& other) const {
    return device == other.device && inode == other.inode && owner == other.owner &&
           mode == other.mode && size == other.size && modified.tv_sec == other.modified.tv_sec &&
           modified.tv_nsec == other.modified.tv_nsec && changed.tv_sec == other.changed.tv_sec &&
           changed.tv_nsec == other.changed.tv_nsec;
  }
};

// lstat as a stamp; nothing when the path cannot be examined (a missing file
// has no stamp, and that too is a state to compare).
std::optional<FileStamp> stampOf(const std::string& path) {
  struct stat st {};
  if (::lstat(path.c_str(), &st) != 0) return std::nullopt;
  return FileStamp::of(st);
}

// Why a file owned and moded as st is not to be trusted, or "" when it is.
std::string distrustReason(const struct stat& st) {
  if (st.st_uid != 0) return "is not owned by root (owner " + std::to_string(st.st_uid) + ")";
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) return "is writable by group or others";
  return {};
}

// Reads the whole of an open file of known size.
bool readAll(int fd, off_t size, std::string* contents, std::string* problem) {
  contents->clear();
  contents->reserve(static_cast<std::size_t>(size));
  char buffer[8192];
  for (;;) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      *problem = "cannot be read: " + errorText(errno);
      return false;
    }
    if (n == 0) return true;
    contents->append(buffer, static_cast<std::size_t>(n));
    if (contents->size() > static_cast<std::size_t>(kMaximumRegistryFileSize)) {
      *problem = "is too large";
      return false;
    }
  }
}

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};
using UniqueDir = std::unique_ptr<DIR, DirCloser>;

bool hasRegistrySuffix(std::string_view name) {
  return name.size() > kRegistrySuffix.size() &&
         name.substr(name.size() - kRegistrySuffix.size()) == kRegistrySuffix;
}

}  // namespace

// ---------------------------------------------------------------------------
// The registry as read at one moment.

struct LinuxCodeSigningIdentity::Registry {
  struct Entry {
    std::string file;  // the registry file's name, for messages
    std::string signingIdentifier;
    std::optional<PlistDictionary> entitlements;
  };

  // The number of changes the watch had reported when this was read.
  std::uint64_t changesSeen = 0;
  // The directory's stamp when it was read; nothing when it was missing.
  std::optional<FileStamp> directoryStamp;
  // Set when the directory itself is not trusted: then nothing is.
  std::string directoryProblem;
  // Every registry file looked at, with its stamp (nothing: it vanished while
  // being read). Sorted by name.
  std::vector<std::pair<std::string, std::optional<FileStamp>>> files;
  // "<file> <reason>" for each file or entry that was ignored.
  std::vector<std::string> problems;
  // Entries by what they match; more than one entry for a key is ambiguous.
  std::map<std::string, std::vector<Entry>, std::less<>> byLabel;
  std::map<std::string, std::vector<Entry>, std::less<>> byExecutable;

  // Whether the directory and its files are still as they were read.
  bool isCurrent(const std::string& directory) const {
    if (stampOf(directory) != directoryStamp) return false;
    for (const auto& [name, stamp] : files) {
      if (stampOf(directory + "/" + name) != stamp) return false;
    }
    return true;
  }

  // Reads one registry file and records its entry or why it was ignored.
  void addFile(int directoryFd, const std::string& name) {
    const UniqueFd fd(
        ::openat(directoryFd, name.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    if (!fd) {
      const int error = errno;
      if (error == ENOENT) return;  // removed since it was listed; the directory stamp tells
      files.emplace_back(name, std::nullopt);
      problems.push_back(name + (error == ELOOP ? std::string(" is a symbolic link")
                                                : " cannot be opened: " + errorText(error)));
      return;
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) {
      files.emplace_back(name, std::nullopt);
      problems.push_back(name + " cannot be examined: " + errorText(errno));
      return;
    }
    // The stamp of what was actually read, so that a change made meanwhile is
    // seen by the next check.
    files.emplace_back(name, FileStamp::of(st));
    if (!S_ISREG(st.st_mode)) {
      problems.push_back(name + " is not a regular file");
      return;
    }
    if (const std::string reason = distrustReason(st); !reason.empty()) {
      problems.push_back(name + " " + reason);
      return;
    }
    if (st.st_size > kMaximumRegistryFileSize) {
      problems.push_back(name + " is too large");
      return;
    }
    std::string contents;
    std::string problem;
    if (!readAll(fd.get(), st.st_size, &contents, &problem)) {
      problems.push_back(name + " " + problem);
      return;
    }
    addEntry(name, parseRegistryFile(contents));
  }

  void addEntry(const std::string& name, const std::optional<PlistValue>& plist) {
    const auto ignore = [&](const std::string& why) { problems.push_back(name + " " + why); };
    if (!plist) return ignore("is not a property list");
    if (!plist->isDictionary()) return ignore("is not a dictionary");

    const PlistValue* identifier = plist->find(kSigningIdentifierKey);
    if (identifier == nullptr || !identifier->isString() || identifier->string()->empty()) {
      return ignore("has no \"SigningIdentifier\" string");
    }
    const PlistValue* entitlements = plist->find(kEntitlementsKey);
    if (entitlements != nullptr && !entitlements->isDictionary()) {
      return ignore("has an \"Entitlements\" value that is not a dictionary");
    }
    const PlistValue* label = plist->find(kLabelKey);
    const PlistValue* executable = plist->find(kExecutableKey);
    if ((label == nullptr) == (executable == nullptr)) {
      return ignore("must have exactly one of \"Label\" and \"Executable\"");
    }

    Entry entry{name, *identifier->string(), std::nullopt};
    if (entitlements != nullptr) entry.entitlements = *entitlements->dictionary();

    if (label != nullptr) {
      if (!label->isString() || label->string()->empty()) {
        return ignore("has a \"Label\" that is not a non-empty string");
      }
      byLabel[*label->string()].push_back(std::move(entry));
      return;
    }
    const std::string* path = executable->string();
    // The path must be written as the kernel reports it, or it never matches.
    if (path == nullptr || path->empty() || path->front() != '/' ||
        std::filesystem::path(*path).lexically_normal().string() != *path) {
      return ignore("has an \"Executable\" that is not a normalized absolute path");
    }
    byExecutable[*path].push_back(std::move(entry));
  }

  static std::shared_ptr<Registry> load(const std::string& directory) {
    auto registry = std::make_shared<Registry>();
    const UniqueFd directoryFd(
        ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
    if (!directoryFd) {
      const int error = errno;
      registry->directoryStamp = stampOf(directory);
      if (error != ENOENT) {
        registry->directoryProblem =
            "registry " + directory + " cannot be opened: " + errorText(error);
      }
      return registry;
    }
    struct stat st {};
    if (::fstat(directoryFd.get(), &st) != 0) {
      registry->directoryProblem =
          "registry " + directory + " cannot be examined: " + errorText(errno);
      return registry;
    }
    // Stamped before listing: a file added meanwhile makes the next check reload.
    registry->directoryStamp = FileStamp::of(st);
    if (const std::string reason = distrustReason(st); !reason.empty()) {
      registry->directoryProblem = "registry " + directory + " is not trusted: it " + reason;
      return registry;
    }

    std::vector<std::string> names;
    {
      UniqueFd listingFd(::dup(directoryFd.get()));
      UniqueDir dir(listingFd ? ::fdopendir(listingFd.get()) : nullptr);
      if (!dir) {
        registry->directoryProblem =
            "registry " + directory + " cannot be listed: " + errorText(errno);
        return registry;
      }
      listingFd.release();  // the stream owns it now
      while (const dirent* entry = ::readdir(dir.get())) {
        if (hasRegistrySuffix(entry->d_name)) names.emplace_back(entry->d_name);
      }
    }
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) registry->addFile(directoryFd.get(), name);
    return registry;
  }
};

// ---------------------------------------------------------------------------

LinuxCodeSigningIdentity::LinuxCodeSigningIdentity(FilesystemRoot root)
    : directory_(root.resolve(kSignaturesDirectory)), watch_(directory_, root.resolve("/")) {}

LinuxCodeSigningIdentity::~LinuxCodeSigningIdentity() = default;

std::shared_ptr<const LinuxCodeSigningIdentity::Registry>
LinuxCodeSigningIdentity::usableRegistryLocked() {
  if (watch_.changed()) ++changes_;
  if (!registry_) return nullptr;
  if (watched_) return registry_->changesSeen == changes_ ? registry_ : nullptr;
  return registry_->isCurrent(directory_) ? registry_ : nullptr;
}

std::shared_ptr<const LinuxCodeSigningIdentity::Registry>
LinuxCodeSigningIdentity::currentRegistry() {
  {
    const std::lock_guard lock(mutex_);
    if (auto registry = usableRegistryLocked()) return registry;
  }
  const std::lock_guard reload(reloadMutex_);
  std::uint64_t changesSeen = 0;
  {
    const std::lock_guard lock(mutex_);
    // Another thread may have read it while this one waited.
    if (auto registry = usableRegistryLocked()) return registry;
    // Watches first: whatever changes from here on is reported.
    watched_ = watch_.arm();
    changesSeen = changes_;
  }
  std::shared_ptr<Registry> registry = Registry::load(directory_);
  registry->changesSeen = changesSeen;
  const std::lock_guard lock(mutex_);
  registry_ = registry;
  return registry;
}

CodeSigningIdentityResult LinuxCodeSigningIdentity::identify(const PeerCredentials& peer) {
  CodeSigningIdentityResult result;
  const std::shared_ptr<const Registry> registry = currentRegistry();
  if (!registry->directoryProblem.empty()) {
    result.error = registry->directoryProblem;
    return result;
  }

  // The label is fixed when the peer connects; where there is one, it alone
  // decides. The executable path is the one read when the connection was accepted.
  const bool byLabel = peer.securityLabel.has_value() && !peer.securityLabel->empty();
  std::string key;
  if (byLabel) {
    key = *peer.securityLabel;
  } else if (peer.executablePath && !peer.executablePath->empty()) {
    key = *peer.executablePath;
  } else {
    result.error = "no security label and no executable known for pid " + std::to_string(peer.pid);
    return result;
  }

  const auto& entries = byLabel ? registry->byLabel : registry->byExecutable;
  const auto found = entries.find(key);
  if (found == entries.end()) {
    result.error = "no registered identity for " + key;
    if (!registry->problems.empty()) {
      result.error += " (ignored registry files:";
      for (const std::string& problem : registry->problems) result.error += " " + problem + ";";
      result.error.back() = ')';
    }
    return result;
  }
  if (found->second.size() > 1) {
    result.error = key + " is registered more than once:";
    for (const Registry::Entry& entry : found->second) result.error += " " + entry.file;
    return result;
  }
  const Registry::Entry& entry = found->second.front();

  if (!byLabel) {
    // Only a binary that no one but root can change stands for the identity:
    // the one the peer ran, as it was when it connected, or the file at its
    // path when that could not be examined then.
    struct stat st {};
    if (peer.executableStatus) {
      st = *peer.executableStatus;
    } else if (::lstat(key.c_str(), &st) != 0) {
      result.error = "executable " + key + " cannot be examined: " + errorText(errno);
      return result;
    }
    if (!S_ISREG(st.st_mode)) {
      result.error = "executable " + key + " is not a regular file";
      return result;
    }
    if (const std::string reason = distrustReason(st); !reason.empty()) {
      result.error = "executable " + key + " " + reason;
      return result;
    }
  }

  result.signingIdentifier = entry.signingIdentifier;
  result.entitlements = entry.entitlements;
  return result;
}

}  // namespace kestrel::platform
