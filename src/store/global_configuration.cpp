#include "store/global_configuration.h"

#include "daemon/log.h"
#include "platform/never_destroyed.h"
#include "platform/services.h"
#include "store/file_manager.h"
#include "store/layout_directory.h"
#include "store/per_user_configuration.h"

namespace kestrel {

namespace {

constexpr uid_t kBundleDirectoryOwner = kKSTInstallerUserId;
// Owner 0 leaves the owner alone: the system class directories keep the
// superuser account they were made with.
constexpr uid_t kSystemDirectoryOwner = kKSTOwnerLeaveAlone;

KSTFileURL systemDirectory(std::string_view systemPath) {
  return KSTFileURL(platform::services().root.resolve(systemPath), true);
}

}  // namespace

KSTGlobalConfiguration& KSTGlobalConfiguration::sharedInstance() {
  static platform::NeverDestroyed<KSTGlobalConfiguration> instance(
      [](void* where) { return new (where) KSTGlobalConfiguration(); });
  return *instance;
}

KSTGlobalConfiguration::KSTGlobalConfiguration()
    : homeDirectory_(systemDirectory("/private/var/root/")),
      tesseldHomeDirectory_(systemDirectory("/private/var/tesseld/")) {
  const auto& accounts = platform::services().accounts;
  std::optional<platform::UserAccount> mobile =
      accounts ? accounts->userByName("mobile") : std::nullopt;
  if (mobile) {
    currentMobileUserId_ = mobile->uid;
    KSTLog(kLogError, "Current mobile user ID is %u", currentMobileUserId_);
  } else {
    KSTLog(kLogError, "Failed to get mobile uid. This is bad");
  }
}

std::shared_ptr<KSTPerUserConfiguration> KSTGlobalConfiguration::getPerUserConfigurationForUserId(
    std::uint32_t userId) {
  std::lock_guard guard(lock_);
  return perUserConfigurationLocked(userId);
}

std::shared_ptr<KSTPerUserConfiguration> KSTGlobalConfiguration::perUserConfigurationLocked(
    std::uint32_t userId) {
  if (auto it = perUserConfigurations_.find(userId); it != perUserConfigurations_.end()) {
    return it->second;
  }
  std::shared_ptr<KSTPerUserConfiguration> configuration =
      KSTPerUserConfiguration::initWithUserId(userId);
  // One without a home is not kept either: the account or its home may
  // appear later, and the next call looks again.
  if (configuration && configuration->userHomeDirectory()) {
    perUserConfigurations_.emplace(userId, configuration);
  }
  return configuration;
}

std::shared_ptr<KSTPerUserConfiguration>
KSTGlobalConfiguration::getPerUserConfigurationForCurrentMobileUser() {
  return getPerUserConfigurationForUserId(currentMobileUserId_);
}

KSTFileURL KSTGlobalConfiguration::sharedContainersDirectory() {
  std::lock_guard guard(lock_);
  return sharedContainersDirectoryLocked();
}

KSTFileURL KSTGlobalConfiguration::sharedContainersDirectoryLocked() {
  if (!sharedContainersDirectory_) {
    sharedContainersDirectory_ = systemDirectory("/private/var/containers");
  }
  return KSTMakeLayoutDirectory("sharedContainersDirectory",
                                "Failed to create shared container dir at \"%@\": %@",
                                *sharedContainersDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::bundleDirectory() {
  std::lock_guard guard(lock_);
  if (!bundleDirectory_) {
    bundleDirectory_ = sharedContainersDirectoryLocked().appending("Bundle", true);
  }
  return KSTMakeLayoutDirectory("bundleDirectory", "Failed to create bundle dir at \"%@\": %@",
                                *bundleDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::cachesDirectory() {
  std::lock_guard guard(lock_);
  return cachesDirectoryLocked();
}

KSTFileURL KSTGlobalConfiguration::cachesDirectoryLocked() {
  if (!cachesDirectory_) {
    cachesDirectory_ = homeDirectory_.appending("Library/Caches/com.zorvane.kestreld", true);
  }
  return KSTMakeLayoutDirectory("cachesDirectory", "Failed to create cache dir at \"%@\": %@",
                                *cachesDirectory_, true, kKSTOwnerLeaveAlone,
                                kKSTLayoutDirectoryProtectionClass);
}

KSTFileURL KSTGlobalConfiguration::transientDirectory() {
  std::lock_guard guard(lock_);
  return transientDirectoryLocked();
}

KSTFileURL KSTGlobalConfiguration::transientDirectoryLocked() {
  if (!transientDirectory_) transientDirectory_ = cachesDirectoryLocked().appending("Temp", true);
  return KSTMakeLayoutDirectory("transientDirectory",
                                "Failed to create transient dir at \"%@\": %@",
                                *transientDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::stagingDirectory() {
  std::lock_guard guard(lock_);
  if (!stagingDirectory_) stagingDirectory_ = cachesDirectoryLocked().appending("Staging", true);
  return KSTMakeLayoutDirectory("stagingDirectory", "Failed to create staging dir at \"%@\": %@",
                                *stagingDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::deathrowDirectory() {
  std::lock_guard guard(lock_);
  if (!deathrowDirectory_) deathrowDirectory_ = cachesDirectoryLocked().appending("Dead", true);
  return KSTMakeLayoutDirectory("deathrowDirectory", "Failed to create deathrow dir at \"%@\": %@",
                                *deathrowDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::libraryDirectory() {
  std::lock_guard guard(lock_);
  return libraryDirectoryLocked();
}

KSTFileURL KSTGlobalConfiguration::libraryDirectoryLocked() {
  if (!libraryDirectory_) libraryDirectory_ = homeDirectory_.appending("Library/Kestrel", true);
  return KSTMakeLayoutDirectory("libraryDirectory", "Failed to create library dir at \"%@\": %@",
                                *libraryDirectory_, true, kKSTOwnerLeaveAlone,
                                kKSTLayoutDirectoryProtectionClass);
}

KSTFileURL KSTGlobalConfiguration::replaceDirectory() {
  std::lock_guard guard(lock_);
  if (!replaceDirectory_) replaceDirectory_ = libraryDirectoryLocked().appending("Replace", true);
  return KSTMakeLayoutDirectory("replaceDirectory", "Failed to create replace dir at \"%@\": %@",
                                *replaceDirectory_, true);
}

KSTFileURL KSTGlobalConfiguration::logDirectory() const {
  return KSTMakeLayoutDirectory("logDirectory", "Failed to create log directory at \"%@\": %@",
                                homeDirectory_.appending("Library/Logs/Kestrel", true), true,
                                kKSTOwnerLeaveAlone, kKSTLayoutDirectoryProtectionClass);
}

KSTFileURL KSTGlobalConfiguration::transientBundleDirectory() {
  std::lock_guard guard(lock_);
  return transientBundleDirectoryLocked();
}

KSTFileURL KSTGlobalConfiguration::transientBundleDirectoryLocked() {
  // Beneath the installer's home, whose parents are not ours to make: each
  // level is made in turn, without parents, owned by the installer.
  KSTFileURL level = tesseldHomeDirectory_;
  for (const char* component : {"Library", "Caches", "com.zorvane.kestreld"}) {
    level = KSTMakeLayoutDirectory("transientBundleDirectory",
                                   "Failed to create transient bundle dir at \"%@\": %@",
                                   level.appending(component, true), false, kBundleDirectoryOwner);
  }
  if (!transientBundleDirectory_) transientBundleDirectory_ = level;
  return *transientBundleDirectory_;
}

std::optional<KSTFileURL> KSTGlobalConfiguration::containerDirectoryURLForUser(
    std::uint32_t user, KSTContainerClass contentClass, bool transient) {
  std::lock_guard guard(lock_);
  const bool bundle = KSTIsBundleClass(contentClass);
  if (bundle || KSTIsSystemClass(contentClass)) {
    KSTFileURL base;
    if (!transient) {
      base = sharedContainersDirectoryLocked();
    } else {
      base = bundle ? transientBundleDirectoryLocked() : transientDirectoryLocked();
    }
    return KSTMakeLayoutDirectory("containerDirectoryURLForUser",
                                  "Failed to create container dir at \"%@\": %@",
                                  base.appending(KSTContainerClassPath(contentClass), true), true,
                                  bundle ? kBundleDirectoryOwner : kSystemDirectoryOwner);
  }
  // Global lock, then the per-user configuration's own lock.
  std::shared_ptr<KSTPerUserConfiguration> configuration = perUserConfigurationLocked(user);
  if (!configuration) return std::nullopt;
  return configuration->containerDirectoryURLForContentClass(contentClass, transient);
}

const std::vector<std::string>& KSTGlobalConfiguration::appUserDataItemNames() {
  static const std::vector<std::string> names{"Documents", "Library", "tmp", "Tillbox"};
  return names;
}

bool KSTGlobalConfiguration::migrationFileExistsWithName(std::string_view name) {
  return KSTFileManager::defaultManager().itemExistsAtURL(libraryDirectory().appending(name));
}

}  // namespace kestrel
