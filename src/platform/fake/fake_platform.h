// In-memory stand-ins for the account database, device facts, keep-alive
// transactions, named semaphores and the key bag, for tests. Each is safe to use
// from several threads and can be set up to answer as a test needs.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/accounts.h"
#include "platform/device_info.h"
#include "platform/keep_alive.h"
#include "platform/key_bag.h"
#include "platform/named_semaphores.h"
#include "platform/root.h"

namespace kestrel::platform {

class FakeAccounts final : public Accounts {
 public:
  // Seeded with the accounts of a test root: root (0), _installd (33),
  // _systemcontainer (499), mobile (501), mobile2 (502), nobody (4294967294) and
  // their groups, with home directories beneath `root`.
  explicit FakeAccounts(FilesystemRoot root = FilesystemRoot("/"));

  // Adds or replaces a user; the home directory is a system path, resolved beneath the root.
  void addUser(const std::string& name, uid_t uid, gid_t gid, const std::string& homeDirectory);
  void addGroup(const std::string& name, gid_t gid);
  void removeUser(const std::string& name);
  void removeGroup(const std::string& name);

  std::optional<UserAccount> userByName(std::string_view name) const override;
  std::optional<UserAccount> userById(uid_t uid) const override;
  std::optional<GroupAccount> groupByName(std::string_view name) const override;
  std::optional<GroupAccount> groupById(gid_t gid) const override;

 private:
  const FilesystemRoot root_;
  mutable std::mutex mutex_;
  std::vector<UserAccount> users_;
  std::vector<GroupAccount> groups_;
};

class FakeDeviceInfo final : public DeviceInfo {
 public:
  void setInternalBuild(bool internal);
  void setBuildVersion(std::string version);

  bool isInternalBuild() const override;
  std::string buildVersion() const override;

 private:
  mutable std::mutex mutex_;
  bool internal_ = false;
  std::string version_ = "Unknown";
};

class FakeKeepAlive final : public KeepAlive {
 public:
  void begin() override;
  // Aborts when no transaction is open, as the real one does.
  void end() override;
  std::uint64_t openTransactions() const override;
  // Every begin() so far, whether or not it has ended.
  std::uint64_t totalBegins() const;

 private:
  mutable std::mutex mutex_;
  std::uint64_t open_ = 0;
  std::uint64_t totalBegins_ = 0;
};

class FakeNamedSemaphores final : public NamedSemaphores {
 public:
  bool openExisting(const std::string& name) override;
  // Records the name unless a failure status was set.
  int create(const std::string& name, unsigned mode, unsigned value) override;
  void remove(const std::string& name) override;

  // Makes create() fail with this errno from now on (0 to succeed again).
  void setCreateStatus(int status);
  std::set<std::string> names() const;

 private:
  mutable std::mutex mutex_;
  std::set<std::string> names_;
  int createStatus_ = 0;
};

class FakeKeyBag final : public KeyBag {
 public:
  void setLockState(int state);
  // nullopt for a device without user-type information.
  void setUserTypeInfo(std::optional<UserTypeInfo> info);
  void setUserSessionIds(std::vector<std::uint32_t> ids);
  // Makes userSessionIds() fail with this text; an empty text makes it succeed again.
  void setUserSessionError(std::string error);
  // Makes registerLockStatusNotification() fail with this status (0 to succeed again).
  void setRegistrationStatus(int status);

  // Posts every registered handler to its queue.
  void notifyLockStatusChanged();
  std::size_t registrationCount() const;
  std::shared_ptr<DispatchQueue> registeredQueue() const;

  int lockState() override;
  int registerLockStatusNotification(std::shared_ptr<DispatchQueue> queue, Work handler) override;
  std::optional<UserTypeInfo> userTypeInfo() override;
  std::optional<std::vector<std::uint32_t>> userSessionIds(std::string* error) override;

 private:
  mutable std::mutex mutex_;
  int lockState_ = kUnlocked;
  std::optional<UserTypeInfo> userTypeInfo_ = UserTypeInfo{};
  std::vector<std::uint32_t> sessionIds_;
  std::string sessionError_;
  int registrationStatus_ = 0;
  std::vector<std::pair<std::shared_ptr<DispatchQueue>, Work>> registrations_;
};

}  // namespace kestrel::platform
