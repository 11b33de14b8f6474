// Extended ACLs on Linux. Linux has no allow/deny list with per-entry
// inheritance flags, so a list set on an item is kept twice:
//
// 1. The exact entries (tag, permission bits, flag bits, group UUID) in the
//    extended attribute "trusted.kestrel.acl", in the text form of
//    encodeAccessControlList(). This is the record getFile() reads back.
// 2. The equivalent POSIX.1e ACL, set with libacl, which the kernel enforces
//    and `getfacl` shows: one named-group entry per group of the list.
//
// Mapping of an allow entry for group G onto POSIX entries of G:
//
//   r  read data / list directory (0x2)
//   w  write data / add file (0x4), append data / add subdirectory (0x20),
//      and on a directory delete child (0x40)
//   x  execute / search (0x8); on a directory also whenever w is granted,
//      because Linux lets nobody add or remove a name in a directory that
//      they cannot search
//
//   On a directory, write rights let POSIX members unlink and rename any
//   name. An entry that adds files or sub-directories but has no delete child
//   therefore becomes rwx plus the sticky bit on that directory: members
//   list, search and add, and remove or rename only what they own.
//
//   An allow entry only adds to what the mode grants everyone, but POSIX
//   stops at the first group entry that matches, so a named group also keeps
//   the bits of other:: (else members would get less than everyone).
//
//   Delete (0x10) is decided by the parent directory, and the attribute,
//   extended-attribute, security and owner bits (0x80-0x2000) by ownership and
//   capabilities on Linux: they have no rwx counterpart.
//
//   An entry that is not inherit-only (0x100) gives G an access entry. On a
//   directory, an entry inherited by files (0x20) or by directories (0x40) also
//   gives G a default entry, mapped as for a file, a directory, or both; POSIX
//   default entries reach new files and directories alike. Entries of one group
//   add up. Inheritance flags on anything but a directory have no effect.
//
// The POSIX lists that result:
//
//   access:   user::, group:: and other:: as the item had them (its mode), the
//             named groups, and a mask that is the union of group:: and them.
//   default:  user:: with the union of the named default entries (so that the
//             member who creates an item, and owns it, keeps the access the
//             group has), group::--- and other::---, the named groups, a mask.
//
// Setting a list replaces the item's named entries and its default list
// altogether; an empty list leaves only the mode.
//
// Where the kernel differs from the list model, and what to expect:
//   - The group bits of an item with named entries are the mask (ls shows
//     ----rwx--- for a list granting a group full control on a mode 0000 item);
//     setModeKeepingACL() therefore sets user::, group:: and other:: and keeps
//     the mask at what the named entries need, instead of a plain chmod that
//     would silence them.
//   - A new item takes its parent's default list masked by its creation mode:
//     an item created with mode 0600 grants the inheriting group nothing until
//     its list is set again.
//   - Deny entries cannot be expressed: setting a list with one fails with
//     EOPNOTSUPP. A qualifier that is not a group membership UUID: EINVAL.
//   - The sticky bit belongs to the directory, not to a POSIX list: it is
//     set or cleared with each list set on a directory, kept by
//     setModeKeepingACL(), and never inherited (an inherited add-only entry
//     reaches new directories as plain write).
//
// Every call opens the item with O_PATH | O_NOFOLLOW and works through
// /proc/self/fd, so that a symbolic link put in place of the item between the
// caller's check and the call is never followed.
#pragma once

#include <sys/acl.h>

#include <memory>

#include "platform/accounts.h"
#include "platform/extended_acl.h"

namespace kestrel::platform {

// The extended attribute holding the exact entries.
inline constexpr const char* kExtendedACLAttribute = "trusted.kestrel.acl";

// An owned libacl list, freed with acl_free.
class UniquePosixACL {
 public:
  UniquePosixACL() = default;
  explicit UniquePosixACL(acl_t acl) : acl_(acl) {}
  ~UniquePosixACL() { reset(); }
  UniquePosixACL(UniquePosixACL&& other) noexcept : acl_(other.release()) {}
  UniquePosixACL& operator=(UniquePosixACL&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  UniquePosixACL(const UniquePosixACL&) = delete;
  UniquePosixACL& operator=(const UniquePosixACL&) = delete;

  acl_t get() const { return acl_; }
  explicit operator bool() const { return acl_ != nullptr; }
  acl_t release() {
    acl_t acl = acl_;
    acl_ = nullptr;
    return acl;
  }
  void reset(acl_t acl = nullptr) {
    if (acl_ != nullptr && acl_ != acl) ::acl_free(acl_);
    acl_ = acl;
  }

 private:
  acl_t acl_ = nullptr;
};

class LinuxExtendedACL final : public ExtendedACL {
 public:
  // Groups are looked up by name in the accounts.
  explicit LinuxExtendedACL(std::shared_ptr<const Accounts> accounts);

  int lookupGroupUUID(std::string_view groupName, Uuid* uuid) const override;
  int setFile(const char* path, int type, const AccessControlList& acl) override;
  int getFile(const char* path, int type, AccessControlList* acl) const override;
  int setModeKeepingACL(const char* path, mode_t mode) override;
  int setDescriptor(int fd, int type, const AccessControlList& acl) override;
  int setModeKeepingACLDescriptor(int fd, mode_t mode) override;

  // The rwx bits (4, 2, 1) that the permission bits grant on a file or a directory.
  static unsigned posixPermissionsFor(std::uint32_t permissions, bool isDirectory);
  // Whether the bits add files or sub-directories without removing any: on a
  // directory, write plus the sticky bit.
  static bool addsWithoutDeletingChildren(std::uint32_t permissions);

  // Whether the record of the item at the /proc/self/fd path asks for the sticky bit.
  static bool recordNeedsStickyBit(const std::string& itemPath);

 private:
  std::shared_ptr<const Accounts> accounts_;
};

}  // namespace kestrel::platform
