// The layout of one mobile user (uid 501 and above): the user's Containers
// directory, transient directory and system container backups, all beneath
// the user's home directory from the account database.
//
// Made by KSTGlobalConfiguration::getPerUserConfigurationForUserId and kept for
// the life of the process once it has a home. Every getter holds this
// configuration's lock_, which ranks below the global configuration's lock
// (see global_configuration.h). A configuration whose account could not be
// found, or whose home directory does not resolve, has no home directory, and
// every directory derived from it is nullopt.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>

#include "store/container_class.h"
#include "store/file_url.h"

namespace kestrel {

class KSTPerUserConfiguration {
  // Only initWithUserId makes configurations.
  struct PrivateTag {
    explicit PrivateTag() = default;
  };

 public:
  // nullptr for an id of 500 or below (logged). Without an account or with a
  // home that does not resolve, a configuration without home directory
  // (logged as well).
  static std::shared_ptr<KSTPerUserConfiguration> initWithUserId(std::uint32_t userId);

  KSTPerUserConfiguration(PrivateTag, std::uint32_t userId,
                          std::optional<KSTFileURL> userHomeDirectory);
  KSTPerUserConfiguration(const KSTPerUserConfiguration&) = delete;
  KSTPerUserConfiguration& operator=(const KSTPerUserConfiguration&) = delete;

  std::uint32_t userId() const { return userId_; }
  // The home directory with every symbolic link resolved.
  const std::optional<KSTFileURL>& userHomeDirectory() const { return userHomeDirectory_; }

  // True when the user's home directory exists. Makes nothing.
  bool existsUserBaseDirectory() const;

  // Home + "Containers" (0755, owner the user, parents).
  std::optional<KSTFileURL> userBaseDirectory();
  // Home + "Library/Caches/com.zorvane.kestreld/Temp" (0755, owner the user, parents).
  std::optional<KSTFileURL> transientDirectory();
  // Home + "Library/Backup/SystemContainers", and its "Data" and "Shared"; not made.
  std::optional<KSTFileURL> systemContainerBackupBaseDirectory();
  std::optional<KSTFileURL> systemContainerBackupDirectory();
  std::optional<KSTFileURL> systemGroupContainerBackupDirectory();
  // Where older releases kept their library and logs; neither made nor kept.
  std::optional<KSTFileURL> oldLibraryDirectoryPath() const;
  std::optional<KSTFileURL> oldLoggingPath() const;

  // The directory of a per-user class (2, 4, 6, 7, 9, 10, 11), made with the
  // user as owner. nullopt (logged) for any other class, and without a home.
  std::optional<KSTFileURL> containerDirectoryURLForContentClass(KSTContainerClass contentClass,
                                                                 bool transient);

 private:
  // The getters' bodies; the caller holds lock_.
  std::optional<KSTFileURL> userBaseDirectoryLocked();
  std::optional<KSTFileURL> transientDirectoryLocked();
  std::optional<KSTFileURL> systemContainerBackupBaseDirectoryLocked();

  const std::uint32_t userId_;
  const std::optional<KSTFileURL> userHomeDirectory_;

  std::mutex lock_;
  std::optional<KSTFileURL> userBaseDirectory_;
  std::optional<KSTFileURL> transientDirectory_;
  std::optional<KSTFileURL> systemContainerBackupBaseDirectory_;
  std::optional<KSTFileURL> systemContainerBackupDirectory_;
  std::optional<KSTFileURL> systemGroupContainerBackupDirectory_;
};

}  // namespace kestrel
