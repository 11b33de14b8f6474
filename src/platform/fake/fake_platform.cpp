#include "platform/fake/fake_platform.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace kestrel::platform {

// ---- FakeAccounts

FakeAccounts::FakeAccounts(FilesystemRoot root) : root_(std::move(root)) {
  addUser("root", 0, 0, "/private/var/root");
  addUser("_installd", 33, 33, "/private/var/tesseld");
  addUser("_systemcontainer", 499, 499, "/private/var/empty");
  addUser("mobile", 501, 501, "/private/var/mobile");
  addUser("mobile2", 502, 502, "/private/var/mobile2");
  addUser("nobody", 4294967294U, 4294967294U, "/var/empty");
  addGroup("wheel", 0);
  addGroup("_installd", 33);
  addGroup("systemusers", 499);
  addGroup("mobile", 501);
  addGroup("mobile2", 502);
  addGroup("nogroup", 4294967294U);
}

void FakeAccounts::addUser(const std::string& name, uid_t uid, gid_t gid,
                           const std::string& homeDirectory) {
  UserAccount user{name, uid, gid, homeDirectory.empty() ? "" : root_.resolve(homeDirectory)};
  std::lock_guard lock(mutex_);
  std::erase_if(users_, [&](const UserAccount& u) { return u.name == name; });
  users_.push_back(std::move(user));
}

void FakeAccounts::addGroup(const std::string& name, gid_t gid) {
  std::lock_guard lock(mutex_);
  std::erase_if(groups_, [&](const GroupAccount& g) { return g.name == name; });
  groups_.push_back(GroupAccount{name, gid});
}

void FakeAccounts::removeUser(const std::string& name) {
  std::lock_guard lock(mutex_);
  std::erase_if(users_, [&](const UserAccount& u) { return u.name == name; });
}

void FakeAccounts::removeGroup(const std::string& name) {
  std::lock_guard lock(mutex_);
  std::erase_if(groups_, [&](const GroupAccount& g) { return g.name == name; });
}

namespace {

// The first match, as the file-backed database answers.
template <typename T, typename Pred>
std::optional<T> findFirst(const std::vector<T>& items, Pred pred) {
  const auto it = std::find_if(items.begin(), items.end(), pred);
  if (it == items.end()) return std::nullopt;
  return *it;
}

}  // namespace

std::optional<UserAccount> FakeAccounts::userByName(std::string_view name) const {
  std::lock_guard lock(mutex_);
  return findFirst(users_, [&](const UserAccount& u) { return u.name == name; });
}

std::optional<UserAccount> FakeAccounts::userById(uid_t uid) const {
  std::lock_guard lock(mutex_);
  return findFirst(users_, [&](const UserAccount& u) { return u.uid == uid; });
}

std::optional<GroupAccount> FakeAccounts::groupByName(std::string_view name) const {
  std::lock_guard lock(mutex_);
  return findFirst(groups_, [&](const GroupAccount& g) { return g.name == name; });
}

std::optional<GroupAccount> FakeAccounts::groupById(gid_t gid) const {
  std::lock_guard lock(mutex_);
  return findFirst(groups_, [&](const GroupAccount& g) { return g.gid == gid; });
}

// ---- FakeDeviceInfo

void FakeDeviceInfo::setInternalBuild(bool internal) {
  std::lock_guard lock(mutex_);
  internal_ = internal;
}

void FakeDeviceInfo::setBuildVersion(std::string version) {
  std::lock_guard lock(mutex_);
  version_ = std::move(version);
}

bool FakeDeviceInfo::isInternalBuild() const {
  std::lock_guard lock(mutex_);
  return internal_;
}

std::string FakeDeviceInfo::buildVersion() const {
  std::lock_guard lock(mutex_);
  return version_;
}

// ---- FakeKeepAlive

void FakeKeepAlive::begin() {
  std::lock_guard lock(mutex_);
  ++open_;
  ++totalBegins_;
}

void FakeKeepAlive::end() {
  std::lock_guard lock(mutex_);
  if (open_ == 0) {
    std::fputs("FakeKeepAlive: transaction ended without one open\n", stderr);
    std::abort();
  }
  --open_;
}

std::uint64_t FakeKeepAlive::openTransactions() const {
  std::lock_guard lock(mutex_);
  return open_;
}

std::uint64_t FakeKeepAlive::totalBegins() const {
  std::lock_guard lock(mutex_);
  return totalBegins_;
}

// ---- FakeNamedSemaphores

bool FakeNamedSemaphores::openExisting(const std::string& name) {
  std::lock_guard lock(mutex_);
  return names_.contains(name);
}

int FakeNamedSemaphores::create(const std::string& name, unsigned /*mode*/, unsigned /*value*/) {
  std::lock_guard lock(mutex_);
  if (createStatus_ != 0) return createStatus_;
  names_.insert(name);
  return 0;
}

void FakeNamedSemaphores::remove(const std::string& name) {
  std::lock_guard lock(mutex_);
  names_.erase(name);
}

void FakeNamedSemaphores::setCreateStatus(int status) {
  std::lock_guard lock(mutex_);
  createStatus_ = status;
}

std::set<std::string> FakeNamedSemaphores::names() const {
  std::lock_guard lock(mutex_);
  return names_;
}

// ---- FakeKeyBag

void FakeKeyBag::setLockState(int state) {
  std::lock_guard lock(mutex_);
  lockState_ = state;
}

void FakeKeyBag::setUserTypeInfo(std::optional<UserTypeInfo> info) {
  std::lock_guard lock(mutex_);
  userTypeInfo_ = info;
}

void FakeKeyBag::setUserSessionIds(std::vector<std::uint32_t> ids) {
  std::lock_guard lock(mutex_);
  sessionIds_ = std::move(ids);
}

void FakeKeyBag::setUserSessionError(std::string error) {
  std::lock_guard lock(mutex_);
  sessionError_ = std::move(error);
}

void FakeKeyBag::setRegistrationStatus(int status) {
  std::lock_guard lock(mutex_);
  registrationStatus_ = status;
}

void FakeKeyBag::notifyLockStatusChanged() {
  std::vector<std::pair<std::shared_ptr<DispatchQueue>, Work>> registrations;
  {
    std::lock_guard lock(mutex_);
    registrations = registrations_;
  }
  // Posted outside the lock: a handler may call back into the key bag.
  for (auto& [queue, handler] : registrations) queue->async(handler);
}

std::size_t FakeKeyBag::registrationCount() const {
  std::lock_guard lock(mutex_);
  return registrations_.size();
}

std::shared_ptr<DispatchQueue> FakeKeyBag::registeredQueue() const {
  std::lock_guard lock(mutex_);
  return registrations_.empty() ? nullptr : registrations_.back().first;
}

int FakeKeyBag::lockState() {
  std::lock_guard lock(mutex_);
  return lockState_;
}

int FakeKeyBag::registerLockStatusNotification(std::shared_ptr<DispatchQueue> queue, Work handler) {
  std::lock_guard lock(mutex_);
  if (registrationStatus_ != 0) return registrationStatus_;
  registrations_.emplace_back(std::move(queue), std::move(handler));
  return 0;
}

std::optional<UserTypeInfo> FakeKeyBag::userTypeInfo() {
  std::lock_guard lock(mutex_);
  return userTypeInfo_;
}

std::optional<std::vector<std::uint32_t>> FakeKeyBag::userSessionIds(std::string* error) {
  std::lock_guard lock(mutex_);
  if (!sessionError_.empty()) {
    if (error != nullptr) *error = sessionError_;
    return std::nullopt;
  }
  return sessionIds_;
}

}  // namespace kestrel::platform
