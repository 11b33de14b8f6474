#include "store/per_user_configuration.h"

#include <climits>

#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <string>

#include "daemon/log.h"
#include "platform/services.h"
#include "store/file_manager.h"
#include "store/layout_directory.h"

namespace kestrel {

namespace {

// The home directory with every symbolic link resolved. A home that cannot
// be resolved (it does not exist, or a component cannot be read) is no home:
// nothing is made outside a home that exists.
std::optional<KSTFileURL> resolvedHomeDirectory(const std::string& home, std::uint32_t userId) {
  std::array<char, PATH_MAX> resolved{};
  if (::realpath(home.c_str(), resolved.data()) == nullptr) {
    KSTLogTag(kLogError, "initWithUserId", "Failed to resolve home directory %s for uid: %u: %s",
              home, userId, std::strerror(errno));
    return std::nullopt;
  }
  return KSTFileURL(resolved.data(), true);
}

}  // namespace

KSTPerUserConfiguration::KSTPerUserConfiguration(PrivateTag, std::uint32_t userId,
                                                 std::optional<KSTFileURL> userHomeDirectory)
    : userId_(userId), userHomeDirectory_(std::move(userHomeDirectory)) {}

std::shared_ptr<KSTPerUserConfiguration> KSTPerUserConfiguration::initWithUserId(
    std::uint32_t userId) {
  if (userId <= 500) {
    KSTLog(kLogError, "userId: %u must be in range", userId);
    return nullptr;
  }
  std::optional<KSTFileURL> home;
  const auto& accounts = platform::services().accounts;
  if (std::optional<platform::UserAccount> account =
          accounts ? accounts->userById(userId) : std::nullopt) {
    home = resolvedHomeDirectory(account->homeDirectory, userId);
  } else {
    KSTLog(kLogError, "Failed to getpwuid for uid: %u", userId);
  }
  return std::make_shared<KSTPerUserConfiguration>(PrivateTag{}, userId, std::move(home));
}

bool KSTPerUserConfiguration::existsUserBaseDirectory() const {
  return userHomeDirectory_ &&
         KSTFileManager::defaultManager().itemExistsAtURL(*userHomeDirectory_);
}

std::optional<KSTFileURL> KSTPerUserConfiguration::userBaseDirectory() {
  std::lock_guard guard(lock_);
  return userBaseDirectoryLocked();
}

std::optional<KSTFileURL> KSTPerUserConfiguration::userBaseDirectoryLocked() {
  if (!userHomeDirectory_) return std::nullopt;
  if (!userBaseDirectory_) userBaseDirectory_ = userHomeDirectory_->appending("Containers", true);
  return KSTMakeLayoutDirectory("userBaseDirectory", "Failed to create user base dir at \"%@\": %@",
                                *userBaseDirectory_, true, userId_);
}

std::optional<KSTFileURL> KSTPerUserConfiguration::transientDirectory() {
  std::lock_guard guard(lock_);
  return transientDirectoryLocked();
}

std::optional<KSTFileURL> KSTPerUserConfiguration::transientDirectoryLocked() {
  if (!userHomeDirectory_) return std::nullopt;
  if (!transientDirectory_) {
    transientDirectory_ = userHomeDirectory_->appending("Library/Caches/com.zorvane.kestreld", true)
                              .appending("Temp", true);
  }
  return KSTMakeLayoutDirectory("transientDirectory",
                                "Failed to create transient dir at \"%@\": %@",
                                *transientDirectory_, true, userId_);
}

std::optional<KSTFileURL> KSTPerUserConfiguration::systemContainerBackupBaseDirectory() {
  std::lock_guard guard(lock_);
  return systemContainerBackupBaseDirectoryLocked();
}

std::optional<KSTFileURL> KSTPerUserConfiguration::systemContainerBackupBaseDirectoryLocked() {
  if (!userHomeDirectory_) return std::nullopt;
  if (!systemContainerBackupBaseDirectory_) {
    systemContainerBackupBaseDirectory_ =
        userHomeDirectory_->appending("Library/Backup/SystemContainers", true);
  }
  return systemContainerBackupBaseDirectory_;
}

std::optional<KSTFileURL> KSTPerUserConfiguration::systemContainerBackupDirectory() {
  std::lock_guard guard(lock_);
  if (!systemContainerBackupDirectory_) {
    const std::optional<KSTFileURL> base = systemContainerBackupBaseDirectoryLocked();
    if (!base) return std::nullopt;
    systemContainerBackupDirectory_ = base->appending("Data", true);
  }
  return systemContainerBackupDirectory_;
}

std::optional<KSTFileURL> KSTPerUserConfiguration::systemGroupContainerBackupDirectory() {
  std::lock_guard guard(lock_);
  if (!systemGroupContainerBackupDirectory_) {
    const std::optional<KSTFileURL> base = systemContainerBackupBaseDirectoryLocked();
    if (!base) return std::nullopt;
    systemGroupContainerBackupDirectory_ = base->appending("Shared", true);
  }
  return systemGroupContainerBackupDirectory_;
}

std::optional<KSTFileURL> KSTPerUserConfiguration::oldLibraryDirectoryPath() const {
  if (!userHomeDirectory_) return std::nullopt;
  return userHomeDirectory_->appending("Library/Kestrel", true);
}

std::optional<KSTFileURL> KSTPerUserConfiguration::oldLoggingPath() const {
  if (!userHomeDirectory_) return std::nullopt;
  return userHomeDirectory_->appending("Library/Logs/Kestrel", true);
}

std::optional<KSTFileURL> KSTPerUserConfiguration::containerDirectoryURLForContentClass(
    KSTContainerClass contentClass, bool transient) {
  if (!KSTIsPerUserClass(contentClass)) {
    KSTLog(kLogError, "Invalid class for a per user container directory: %llu", contentClass);
    return std::nullopt;
  }
  std::lock_guard guard(lock_);
  const std::optional<KSTFileURL> base =
      transient ? transientDirectoryLocked() : userBaseDirectoryLocked();
  if (!base) return std::nullopt;
  return KSTMakeLayoutDirectory(
      "containerDirectoryURLForContentClass", "Failed to create container dir at \"%@\": %@",
      base->appending(KSTContainerClassPath(contentClass), true), true, userId_);
}

}  // namespace kestrel
