#include "platform/linux/extended_acl_linux.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cerrno>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// The record is a few lines per entry; anything larger is not ours.
constexpr std::size_t kMaxRecordSize = std::size_t{64} * 1024;

// rwx as the kernel's permission sets hold them.
constexpr unsigned kPosixRead = 4;
constexpr unsigned kPosixWrite = 2;
constexpr unsigned kPosixExecute = 1;

// The grants of one POSIX list: the owner, owning-group and other classes, and
// the named groups.
struct PosixGrants {
  unsigned user = 0;
  unsigned group = 0;
  unsigned other = 0;
  std::map<gid_t, unsigned> groups;
};

// An item opened without following a symbolic link, reachable by path through
// its descriptor.
struct OpenedItem {
  UniqueFd fd;
  struct stat st {};
  std::string path;  // "/proc/self/fd/N"
};

int describeItem(OpenedItem* item) {
  if (!item->fd) return errno;
  if (::fstat(item->fd.get(), &item->st) != 0) return errno;
  item->path = "/proc/self/fd/" + std::to_string(item->fd.get());
  return 0;
}

int openItem(const char* path, OpenedItem* item) {
  if (path == nullptr) return EINVAL;
  item->fd = UniqueFd(::open(path, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  return describeItem(item);
}

// The item of a descriptor the caller keeps: a copy of its own.
int adoptItem(int fd, OpenedItem* item) {
  if (fd < 0) return EBADF;
  item->fd = UniqueFd(::fcntl(fd, F_DUPFD_CLOEXEC, 0));
  return describeItem(item);
}

int setEntryPermissions(acl_entry_t entry, unsigned bits) {
  acl_permset_t permset = nullptr;
  if (::acl_get_permset(entry, &permset) != 0) return errno;
  if (::acl_clear_perms(permset) != 0) return errno;
  for (const acl_perm_t perm : {ACL_READ, ACL_WRITE, ACL_EXECUTE}) {
    if ((bits & perm) != 0 && ::acl_add_perm(permset, perm) != 0) return errno;
  }
  if (::acl_set_permset(entry, permset) != 0) return errno;
  return 0;
}

int entryPermissions(acl_entry_t entry, unsigned* bits) {
  acl_permset_t permset = nullptr;
  if (::acl_get_permset(entry, &permset) != 0) return errno;
  *bits = 0;
  for (const acl_perm_t perm : {ACL_READ, ACL_WRITE, ACL_EXECUTE}) {
    const int has = ::acl_get_perm(permset, perm);
    if (has < 0) return errno;
    if (has == 1) *bits |= perm;
  }
  return 0;
}

int addEntry(UniquePosixACL* acl, acl_tag_t tag, const gid_t* qualifier, unsigned bits) {
  acl_t handle = acl->get();
  acl_entry_t entry = nullptr;
  const int created = ::acl_create_entry(&handle, &entry);
  if (handle != acl->get()) {
    acl->release();
    acl->reset(handle);
  }
  if (created != 0) return errno;
  if (::acl_set_tag_type(entry, tag) != 0) return errno;
  if (qualifier != nullptr && ::acl_set_qualifier(entry, qualifier) != 0) return errno;
  return setEntryPermissions(entry, bits);
}

int buildPosixACL(const PosixGrants& grants, UniquePosixACL* out) {
  UniquePosixACL acl(::acl_init(static_cast<int>(grants.groups.size()) + 4));
  if (!acl) return errno;
  int failure = addEntry(&acl, ACL_USER_OBJ, nullptr, grants.user);
  if (failure == 0) failure = addEntry(&acl, ACL_GROUP_OBJ, nullptr, grants.group);
  if (failure == 0) failure = addEntry(&acl, ACL_OTHER, nullptr, grants.other);
  for (const auto& [gid, bits] : grants.groups) {
    if (failure == 0) failure = addEntry(&acl, ACL_GROUP, &gid, bits);
  }
  if (failure != 0) return failure;
  if (!grants.groups.empty()) {
    acl_t handle = acl.get();
    const int calculated = ::acl_calc_mask(&handle);
    if (handle != acl.get()) {
      acl.release();
      acl.reset(handle);
    }
    if (calculated != 0) return errno;
  }
  if (::acl_valid(acl.get()) != 0) return EINVAL;
  *out = std::move(acl);
  return 0;
}

// The owner, owning-group and other entries of the item's access list (its
// mode when it has no list).
int readBaseGrants(const std::string& path, PosixGrants* grants) {
  const UniquePosixACL current(::acl_get_file(path.c_str(), ACL_TYPE_ACCESS));
  if (!current) return errno;
  acl_entry_t entry = nullptr;
  for (int which = ACL_FIRST_ENTRY;; which = ACL_NEXT_ENTRY) {
    const int got = ::acl_get_entry(current.get(), which, &entry);
    if (got < 0) return errno;
    if (got == 0) break;
    acl_tag_t tag = ACL_UNDEFINED_TAG;
    if (::acl_get_tag_type(entry, &tag) != 0) return errno;
    unsigned* slot = tag == ACL_USER_OBJ    ? &grants->user
                     : tag == ACL_GROUP_OBJ ? &grants->group
                     : tag == ACL_OTHER     ? &grants->other
                                            : nullptr;
    if (slot != nullptr) {
      if (const int failure = entryPermissions(entry, slot); failure != 0) return failure;
    }
  }
  return 0;
}

int setPosixACL(const std::string& path, acl_type_t type, const PosixGrants& grants) {
  UniquePosixACL acl;
  if (const int failure = buildPosixACL(grants, &acl); failure != 0) return failure;
  if (::acl_set_file(path.c_str(), type, acl.get()) != 0) return errno;
  return 0;
}

// Sets or clears a directory's sticky bit, keeping the rest of its mode (whose
// group bits are the list's mask).
int setStickyBit(const OpenedItem& item, bool on) {
  struct stat st {};
  if (::fstat(item.fd.get(), &st) != 0) return errno;
  const mode_t mode = on ? (st.st_mode | S_ISVTX) : (st.st_mode & ~S_ISVTX);
  if ((mode & 07777) == (st.st_mode & 07777)) return 0;
  return ::chmod(item.path.c_str(), mode & 07777) == 0 ? 0 : errno;
}

// The record of the item at path: through a /proc/self/fd path when follow is
// set, else never following a link at path. ENOENT when there is none.
int readRecord(const char* path, bool follow, AccessControlList* acl) {
  const auto get = follow ? ::getxattr : ::lgetxattr;
  std::string record(256, '\0');
  for (;;) {
    const ssize_t size = get(path, kExtendedACLAttribute, record.data(), record.size());
    if (size >= 0) {
      record.resize(static_cast<std::size_t>(size));
      break;
    }
    if (errno == ENODATA) return ENOENT;
    if (errno != ERANGE) return errno;
    const ssize_t needed = get(path, kExtendedACLAttribute, nullptr, 0);
    if (needed < 0) return errno == ENODATA ? ENOENT : errno;
    if (static_cast<std::size_t>(needed) > kMaxRecordSize) return EINVAL;
    record.resize(static_cast<std::size_t>(needed) + 1);
  }
  std::optional<AccessControlList> decoded = decodeAccessControlList(record);
  if (!decoded) return EINVAL;
  *acl = std::move(*decoded);
  return 0;
}

int writeRecord(const std::string& path, const AccessControlList& acl) {
  if (acl.entries.empty()) {
    if (::removexattr(path.c_str(), kExtendedACLAttribute) != 0 && errno != ENODATA) return errno;
    return 0;
  }
  const std::string record = encodeAccessControlList(acl);
  if (::setxattr(path.c_str(), kExtendedACLAttribute, record.data(), record.size(), 0) != 0) {
    return errno;
  }
  return 0;
}

}  // namespace

LinuxExtendedACL::LinuxExtendedACL(std::shared_ptr<const Accounts> accounts)
    : accounts_(std::move(accounts)) {}

bool LinuxExtendedACL::addsWithoutDeletingChildren(std::uint32_t permissions) {
  return (permissions & (kACLWriteData | kACLAppendData)) != 0 &&
         (permissions & kACLDeleteChild) == 0;
}

unsigned LinuxExtendedACL::posixPermissionsFor(std::uint32_t permissions, bool isDirectory) {
  std::uint32_t writeBits = kACLWriteData | kACLAppendData;
  if (isDirectory) writeBits |= kACLDeleteChild;
  unsigned bits = 0;
  if ((permissions & kACLReadData) != 0) bits |= kPosixRead;
  if ((permissions & writeBits) != 0) bits |= kPosixWrite;
  if ((permissions & kACLExecute) != 0) bits |= kPosixExecute;
  if (isDirectory && (bits & kPosixWrite) != 0) bits |= kPosixExecute;
  // Adding without removing is write plus the sticky bit; members list the
  // names they may add beside, as everyone else may.
  if (isDirectory && addsWithoutDeletingChildren(permissions)) bits |= kPosixRead;
  return bits;
}

int LinuxExtendedACL::lookupGroupUUID(std::string_view groupName, Uuid* uuid) const {
  if (uuid == nullptr) return EINVAL;
  if (!accounts_) return ENOSYS;
  const std::optional<GroupAccount> group = accounts_->groupByName(groupName);
  if (!group) return ENOENT;
  *uuid = groupMembershipUUID(group->gid);
  return 0;
}

namespace {

int checkList(int type, const AccessControlList& acl, std::vector<gid_t>* gids) {
  if (type != kACLTypeExtended) return EINVAL;
  // Everything the kernel cannot be told is refused before the item is touched.
  gids->reserve(acl.entries.size());
  for (const AccessControlEntry& entry : acl.entries) {
    if (entry.tag == kACLTagExtendedDeny) return EOPNOTSUPP;
    if (entry.tag != kACLTagExtendedAllow) return EINVAL;
    if ((entry.permissions & ~kACLAllPermissions) != 0 || (entry.flags & ~kACLAllFlags) != 0) {
      return EINVAL;
    }
    const std::optional<gid_t> gid = gidOfGroupMembershipUUID(entry.qualifier);
    if (!gid) return EINVAL;
    gids->push_back(*gid);
  }
  return 0;
}

int setOnItem(const OpenedItem& item, const AccessControlList& acl,
              const std::vector<gid_t>& gids) {
  if (S_ISLNK(item.st.st_mode)) return ELOOP;
  const bool isDirectory = S_ISDIR(item.st.st_mode);

  PosixGrants access;
  if (const int failure = readBaseGrants(item.path, &access); failure != 0) return failure;
  // A new item made by a member of a group is owned by that member: the owner
  // class gets what the group inherits. group:: and other:: get nothing.
  PosixGrants inherited;
  bool sticky = false;
  for (std::size_t i = 0; i < acl.entries.size(); ++i) {
    const AccessControlEntry& entry = acl.entries[i];
    if ((entry.flags & kACLEntryInheritOnly) == 0) {
      access.groups[gids[i]] |=
          LinuxExtendedACL::posixPermissionsFor(entry.permissions, isDirectory);
      sticky = sticky ||
               (isDirectory && LinuxExtendedACL::addsWithoutDeletingChildren(entry.permissions));
    }
    if (!isDirectory) continue;
    unsigned bits = 0;
    if ((entry.flags & kACLEntryFileInherit) != 0) {
      bits |= LinuxExtendedACL::posixPermissionsFor(entry.permissions, false);
    }
    if ((entry.flags & kACLEntryDirectoryInherit) != 0) {
      bits |= LinuxExtendedACL::posixPermissionsFor(entry.permissions, true);
    }
    if (bits != 0) {
      inherited.groups[gids[i]] |= bits;
      inherited.user |= bits;
    }
  }

  // An allow entry adds to what the mode grants everyone, but POSIX stops at
  // the first group entry that matches: a named group keeps what other:: has.
  for (auto& [gid, bits] : access.groups) bits |= access.other;
  if (const int failure = setPosixACL(item.path, ACL_TYPE_ACCESS, access); failure != 0) {
    return failure;
  }
  if (isDirectory) {
    if (const int failure = setStickyBit(item, sticky); failure != 0) return failure;
  }
  if (isDirectory) {
    if (inherited.groups.empty()) {
      if (::acl_delete_def_file(item.path.c_str()) != 0) return errno;
    } else if (const int failure = setPosixACL(item.path, ACL_TYPE_DEFAULT, inherited);
               failure != 0) {
      return failure;
    }
  }
  // The record last: it never names entries that the kernel was not given.
  return writeRecord(item.path, acl);
}

}  // namespace

int LinuxExtendedACL::setFile(const char* path, int type, const AccessControlList& acl) {
  std::vector<gid_t> gids;
  if (const int failure = checkList(type, acl, &gids); failure != 0) return failure;
  OpenedItem item;
  if (const int failure = openItem(path, &item); failure != 0) return failure;
  return setOnItem(item, acl, gids);
}

int LinuxExtendedACL::setDescriptor(int fd, int type, const AccessControlList& acl) {
  std::vector<gid_t> gids;
  if (const int failure = checkList(type, acl, &gids); failure != 0) return failure;
  OpenedItem item;
  if (const int failure = adoptItem(fd, &item); failure != 0) return failure;
  return setOnItem(item, acl, gids);
}

int LinuxExtendedACL::getFile(const char* path, int type, AccessControlList* acl) const {
  if (path == nullptr || acl == nullptr || type != kACLTypeExtended) return EINVAL;
  return readRecord(path, false, acl);
}

bool LinuxExtendedACL::recordNeedsStickyBit(const std::string& itemPath) {
  AccessControlList acl;
  if (readRecord(itemPath.c_str(), true, &acl) != 0) return false;
  for (const AccessControlEntry& entry : acl.entries) {
    if ((entry.flags & kACLEntryInheritOnly) == 0 &&
        addsWithoutDeletingChildren(entry.permissions)) {
      return true;
    }
  }
  return false;
}

namespace {

int setModeOnItem(const OpenedItem& item, mode_t mode) {
  if (S_ISLNK(item.st.st_mode)) return EOPNOTSUPP;
  const char* itemPath = item.path.c_str();

  UniquePosixACL current(::acl_get_file(itemPath, ACL_TYPE_ACCESS));
  if (!current && errno != EOPNOTSUPP) return errno;
  if (!current || ::acl_equiv_mode(current.get(), nullptr) == 0) {
    // Nothing but the mode: a plain chmod.
    return ::chmod(itemPath, mode & 07777) == 0 ? 0 : errno;
  }

  // Named entries: the owner, owning-group and other entries take the mode,
  // and the mask is what group:: and the named entries need.
  acl_entry_t entry = nullptr;
  for (int which = ACL_FIRST_ENTRY;; which = ACL_NEXT_ENTRY) {
    const int got = ::acl_get_entry(current.get(), which, &entry);
    if (got < 0) return errno;
    if (got == 0) break;
    acl_tag_t tag = ACL_UNDEFINED_TAG;
    if (::acl_get_tag_type(entry, &tag) != 0) return errno;
    const int shift = tag == ACL_USER_OBJ    ? 6
                      : tag == ACL_GROUP_OBJ ? 3
                      : tag == ACL_OTHER     ? 0
                                             : -1;
    if (shift < 0) continue;
    if (const int failure = setEntryPermissions(entry, (mode >> shift) & 07); failure != 0) {
      return failure;
    }
  }
  acl_t handle = current.get();
  const int calculated = ::acl_calc_mask(&handle);
  if (handle != current.get()) {
    current.release();
    current.reset(handle);
  }
  if (calculated != 0) return errno;
  if (::acl_set_file(itemPath, ACL_TYPE_ACCESS, current.get()) != 0) return errno;

  // The set-id and sticky bits are not part of the POSIX list; a directory
  // keeps the sticky bit its record needs.
  struct stat st {};
  if (::fstat(item.fd.get(), &st) != 0) return errno;
  mode_t wanted = (mode & 07000) | (st.st_mode & 0777);
  if (S_ISDIR(st.st_mode) && LinuxExtendedACL::recordNeedsStickyBit(item.path)) wanted |= S_ISVTX;
  if ((st.st_mode & 07777) != wanted && ::chmod(itemPath, wanted) != 0) return errno;
  return 0;
}

}  // namespace

int LinuxExtendedACL::setModeKeepingACL(const char* path, mode_t mode) {
  OpenedItem item;
  if (const int failure = openItem(path, &item); failure != 0) return failure;
  return setModeOnItem(item, mode);
}

int LinuxExtendedACL::setModeKeepingACLDescriptor(int fd, mode_t mode) {
  OpenedItem item;
  if (const int failure = adoptItem(fd, &item); failure != 0) return failure;
  return setModeOnItem(item, mode);
}

}  // namespace kestrel::platform
