// The process-wide layout object: the daemon's own directories, the
// directories of the classes that belong to no mobile user, the per-user
// configurations, and the current mobile user id.
//
// Every directory getter makes its directory on demand, so a caller may assume
// it exists, and never fails: a directory that cannot be made is logged at
// error level and its URL is returned anyway. Directory paths are computed on
// first use and kept (logDirectory excepted); the making is repeated on every
// call, so a directory removed behind our back comes back.
//
// Lock order (outermost first):
//   KSTContainerCache's cache lock
//     -> KSTGlobalConfiguration::lock_
//       -> KSTPerUserConfiguration::lock_
// The class-directory getter holds the global lock while it asks a per-user
// configuration, which then takes its own lock; nothing here ever calls back
// into the cache, and a per-user configuration never takes the global lock.
// logDirectory takes no lock at all.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "store/container_class.h"
#include "store/file_url.h"

namespace kestrel {

class KSTPerUserConfiguration;

class KSTGlobalConfiguration {
 public:
  static KSTGlobalConfiguration& sharedInstance();

  KSTGlobalConfiguration(const KSTGlobalConfiguration&) = delete;
  KSTGlobalConfiguration& operator=(const KSTGlobalConfiguration&) = delete;

  // The uid of the account "mobile", looked up once; 0 when the lookup failed.
  std::uint32_t currentMobileUserId() const { return currentMobileUserId_; }

  // The daemon's own home ("/private/var/root/") and the installer's home
  // ("/private/var/tesseld/"), beneath the filesystem root.
  const KSTFileURL& homeDirectory() const { return homeDirectory_; }
  const KSTFileURL& tesseldHomeDirectory() const { return tesseldHomeDirectory_; }

  // The configuration of a mobile user, made on first use and kept. nullptr
  // for an id of 500 or below; a failed make is tried again on the next call.
  std::shared_ptr<KSTPerUserConfiguration> getPerUserConfigurationForUserId(std::uint32_t userId);
  std::shared_ptr<KSTPerUserConfiguration> getPerUserConfigurationForCurrentMobileUser();

  // "/private/var/containers" (0755, parents).
  KSTFileURL sharedContainersDirectory();
  // Shared containers directory + "Bundle" (0755, parents).
  KSTFileURL bundleDirectory();
  // Home + "Library/Caches/com.zorvane.kestreld" (0755, class 4, parents).
  KSTFileURL cachesDirectory();
  // Caches directory + "Temp": transient containers of the system classes.
  KSTFileURL transientDirectory();
  // Caches directory + "Staging": containers under construction.
  KSTFileURL stagingDirectory();
  // Caches directory + "Dead": containers waiting for destruction.
  KSTFileURL deathrowDirectory();
  // Home + "Library/Kestrel" (0755, class 4, parents): the migration markers.
  KSTFileURL libraryDirectory();
  // Library directory + "Replace": the replace journal.
  KSTFileURL replaceDirectory();
  // Home + "Library/Logs/Kestrel" (0755, class 4, parents). Not kept: rebuilt
  // on every call, and takes no lock, so the log can be opened at any time.
  KSTFileURL logDirectory() const;
  // Installer home + "Library/Caches/com.zorvane.kestreld", each of the three
  // levels made in turn (0755, owner 33, no parents): transient bundles.
  KSTFileURL transientBundleDirectory();

  // The directory of a class for the user (made with its owner), or nullopt
  // for a per-user class of a user without a configuration or home, and for a
  // class that is no class.
  std::optional<KSTFileURL> containerDirectoryURLForUser(std::uint32_t user,
                                                         KSTContainerClass contentClass,
                                                         bool transient);

  // "Documents", "Library", "tmp", "Tillbox", in this order.
  static const std::vector<std::string>& appUserDataItemNames();

  // True when an item of that name exists directly in the library directory.
  bool migrationFileExistsWithName(std::string_view name);

 private:
  KSTGlobalConfiguration();

  // The getters' bodies; the caller holds lock_.
  std::shared_ptr<KSTPerUserConfiguration> perUserConfigurationLocked(std::uint32_t userId);
  KSTFileURL sharedContainersDirectoryLocked();
  KSTFileURL cachesDirectoryLocked();
  KSTFileURL transientDirectoryLocked();
  KSTFileURL libraryDirectoryLocked();
  KSTFileURL transientBundleDirectoryLocked();

  const KSTFileURL homeDirectory_;
  const KSTFileURL tesseldHomeDirectory_;
  std::uint32_t currentMobileUserId_ = 0;

  std::mutex lock_;
  std::map<std::uint32_t, std::shared_ptr<KSTPerUserConfiguration>> perUserConfigurations_;
  std::optional<KSTFileURL> sharedContainersDirectory_;
  std::optional<KSTFileURL> cachesDirectory_;
  std::optional<KSTFileURL> libraryDirectory_;
  std::optional<KSTFileURL> stagingDirectory_;
  std::optional<KSTFileURL> deathrowDirectory_;
  std::optional<KSTFileURL> replaceDirectory_;
  std::optional<KSTFileURL> bundleDirectory_;
  std::optional<KSTFileURL> transientDirectory_;
  std::optional<KSTFileURL> transientBundleDirectory_;
};

}  // namespace kestrel
