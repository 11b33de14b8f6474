#include "platform/fake/fake_extended_acl.h"

#include <unistd.h>

#include <sys/stat.h>

#include <cerrno>

namespace kestrel::platform {

namespace {

// 0 for an item that exists and is not a symbolic link, else linkError or errno.
int checkItem(const char* path, int linkError) {
  if (path == nullptr) return EINVAL;
  struct stat st {};
  if (::lstat(path, &st) != 0) return errno;
  return S_ISLNK(st.st_mode) ? linkError : 0;
}

}  // namespace

FakeExtendedACL::FakeExtendedACL(std::shared_ptr<const Accounts> accounts)
    : accounts_(std::move(accounts)) {}

void FakeExtendedACL::failStep(const std::string& step, int errnum, const std::string& pathPart,
                               int times) {
  std::lock_guard lock(mutex_);
  if (errnum == 0 || times == 0) {
    failures_.erase(step);
  } else {
    failures_[step] = Failure{errnum, pathPart, times};
  }
}

void FakeExtendedACL::clearFailures() {
  std::lock_guard lock(mutex_);
  failures_.clear();
}

std::map<std::string, AccessControlList> FakeExtendedACL::appliedACLs() const {
  std::lock_guard lock(mutex_);
  return applied_;
}

std::optional<AccessControlList> FakeExtendedACL::aclAt(const std::string& path) const {
  std::lock_guard lock(mutex_);
  const auto it = applied_.find(path);
  if (it == applied_.end()) return std::nullopt;
  return it->second;
}

std::vector<std::pair<std::string, mode_t>> FakeExtendedACL::modeChanges() const {
  std::lock_guard lock(mutex_);
  return modeChanges_;
}

int FakeExtendedACL::failure(const std::string& step, const char* path) const {
  std::lock_guard lock(mutex_);
  const auto it = failures_.find(step);
  if (it == failures_.end()) return 0;
  Failure& f = it->second;
  if (!f.pathPart.empty() &&
      (path == nullptr || std::string_view(path).find(f.pathPart) == std::string_view::npos)) {
    return 0;
  }
  const int errnum = f.errnum;
  if (f.remaining > 0 && --f.remaining == 0) failures_.erase(it);
  return errnum;
}

int FakeExtendedACL::init(int count, AccessControlList* acl) {
  if (const int e = failure("acl_init"); e != 0) return e;
  return ExtendedACL::init(count, acl);
}

int FakeExtendedACL::createEntry(AccessControlList* acl, ACLEntryIndex* entry) {
  if (const int e = failure("acl_create_entry"); e != 0) return e;
  return ExtendedACL::createEntry(acl, entry);
}

int FakeExtendedACL::getPermset(const AccessControlList& acl, ACLEntryIndex entry,
                                std::uint32_t* permset) {
  if (const int e = failure("acl_get_permset"); e != 0) return e;
  return ExtendedACL::getPermset(acl, entry, permset);
}

int FakeExtendedACL::addPerm(std::uint32_t* permset, std::uint32_t perm) {
  if (const int e = failure("acl_add_perm"); e != 0) return e;
  return ExtendedACL::addPerm(permset, perm);
}

int FakeExtendedACL::setPermset(AccessControlList* acl, ACLEntryIndex entry,
                                std::uint32_t permset) {
  if (const int e = failure("acl_set_permset"); e != 0) return e;
  return ExtendedACL::setPermset(acl, entry, permset);
}

int FakeExtendedACL::getFlagset(const AccessControlList& acl, ACLEntryIndex entry,
                                std::uint32_t* flagset) {
  if (const int e = failure("acl_get_flagset_np"); e != 0) return e;
  return ExtendedACL::getFlagset(acl, entry, flagset);
}

int FakeExtendedACL::addFlag(std::uint32_t* flagset, std::uint32_t flag) {
  if (const int e = failure("acl_add_flag_np"); e != 0) return e;
  return ExtendedACL::addFlag(flagset, flag);
}

int FakeExtendedACL::setFlagset(AccessControlList* acl, ACLEntryIndex entry,
                                std::uint32_t flagset) {
  if (const int e = failure("acl_set_flagset_np"); e != 0) return e;
  return ExtendedACL::setFlagset(acl, entry, flagset);
}

int FakeExtendedACL::setTagType(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t tag) {
  if (const int e = failure("acl_set_tag_type"); e != 0) return e;
  return ExtendedACL::setTagType(acl, entry, tag);
}

int FakeExtendedACL::setQualifier(AccessControlList* acl, ACLEntryIndex entry,
                                  const Uuid& qualifier) {
  if (const int e = failure("acl_set_qualifier"); e != 0) return e;
  return ExtendedACL::setQualifier(acl, entry, qualifier);
}

int FakeExtendedACL::lookupGroupUUID(std::string_view groupName, Uuid* uuid) const {
  if (const int e = failure("lookup_group_uuid"); e != 0) return e;
  if (uuid == nullptr) return EINVAL;
  const std::optional<GroupAccount> group =
      accounts_ ? accounts_->groupByName(groupName) : std::nullopt;
  if (!group) return ENOENT;
  *uuid = groupMembershipUUID(group->gid);
  return 0;
}

int FakeExtendedACL::setFile(const char* path, int type, const AccessControlList& acl) {
  if (const int e = failure("acl_set_file", path); e != 0) return e;
  if (type != kACLTypeExtended) return EINVAL;
  if (const int e = checkItem(path, ELOOP); e != 0) return e;
  std::lock_guard lock(mutex_);
  if (acl.entries.empty()) {
    applied_.erase(path);
  } else {
    applied_[path] = acl;
  }
  return 0;
}

int FakeExtendedACL::getFile(const char* path, int type, AccessControlList* acl) const {
  if (path == nullptr || acl == nullptr || type != kACLTypeExtended) return EINVAL;
  std::lock_guard lock(mutex_);
  const auto it = applied_.find(path);
  if (it == applied_.end()) return ENOENT;
  *acl = it->second;
  return 0;
}

int FakeExtendedACL::setModeKeepingACL(const char* path, mode_t mode) {
  if (const int e = failure("chmod", path); e != 0) return e;
  if (const int e = checkItem(path, EOPNOTSUPP); e != 0) return e;
  std::lock_guard lock(mutex_);
  modeChanges_.emplace_back(path, mode);
  return 0;
}

namespace {

// The path a descriptor's item has now; empty when it has none.
std::string pathOfDescriptor(int fd) {
  std::string path(4096, '\0');
  const std::string link = "/proc/self/fd/" + std::to_string(fd);
  const ssize_t n = ::readlink(link.c_str(), path.data(), path.size());
  if (n <= 0) return {};
  path.resize(static_cast<std::size_t>(n));
  return path;
}

}  // namespace

int FakeExtendedACL::setDescriptor(int fd, int type, const AccessControlList& acl) {
  const std::string path = pathOfDescriptor(fd);
  return path.empty() ? EBADF : setFile(path.c_str(), type, acl);
}

int FakeExtendedACL::setModeKeepingACLDescriptor(int fd, mode_t mode) {
  const std::string path = pathOfDescriptor(fd);
  return path.empty() ? EBADF : setModeKeepingACL(path.c_str(), mode);
}

}  // namespace kestrel::platform
