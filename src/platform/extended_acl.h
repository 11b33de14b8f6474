// Extended access-control lists: ordered allow/deny entries, each naming a
// group by its 16-byte membership UUID and carrying permission bits and
// inheritance flags. A list is built in memory step by step, with the calls of
// the POSIX.1e ACL interface (init, create entry, get/add/set permission set,
// get/add/set flag set, set tag type, set qualifier), and then set on a path as
// a whole, replacing the list the item had.
//
// Every call returns 0 or an errno value. The building calls have one meaning
// on every platform and are implemented here; an implementation may override
// them (a fake does, to fail at a chosen step).
//
// The membership UUID of a group is derived from its gid alone, so that it is
// stable across renames and the same on every machine:
//
//   4B535447-0000-8000-8000-0000XXXXXXXX
//
// bytes 0-3 are the ASCII "KSTG", byte 6 carries version 8 (vendor-defined) and
// byte 8 the RFC 4122 variant, and bytes 12-15 are the gid, big-endian (gid 499
// is 4B535447-0000-8000-8000-0000000001F3). Any other UUID names no group.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/uuid.h"

namespace kestrel::platform {

// The type of list set on a path: the extended list.
inline constexpr int kACLTypeExtended = 256;

// Tags. An entry that was never given one is undefined and cannot be set.
inline constexpr std::uint32_t kACLTagUndefined = 0;
inline constexpr std::uint32_t kACLTagExtendedAllow = 1;
inline constexpr std::uint32_t kACLTagExtendedDeny = 2;

// Permission bits.
inline constexpr std::uint32_t kACLReadData = 0x2;   // read data / list directory
inline constexpr std::uint32_t kACLWriteData = 0x4;  // write data / add file
inline constexpr std::uint32_t kACLExecute = 0x8;    // execute / search
inline constexpr std::uint32_t kACLDelete = 0x10;
inline constexpr std::uint32_t kACLAppendData = 0x20;  // append data / add subdirectory
inline constexpr std::uint32_t kACLDeleteChild = 0x40;
inline constexpr std::uint32_t kACLReadAttributes = 0x80;
inline constexpr std::uint32_t kACLWriteAttributes = 0x100;
inline constexpr std::uint32_t kACLReadExtAttributes = 0x200;
inline constexpr std::uint32_t kACLWriteExtAttributes = 0x400;
inline constexpr std::uint32_t kACLReadSecurity = 0x800;
inline constexpr std::uint32_t kACLWriteSecurity = 0x1000;
inline constexpr std::uint32_t kACLChangeOwner = 0x2000;
inline constexpr std::uint32_t kACLAllPermissions = 0x3FFE;

// Flag bits.
inline constexpr std::uint32_t kACLEntryInherited = 0x10;
inline constexpr std::uint32_t kACLEntryFileInherit = 0x20;
inline constexpr std::uint32_t kACLEntryDirectoryInherit = 0x40;
inline constexpr std::uint32_t kACLEntryInheritOnly = 0x100;
inline constexpr std::uint32_t kACLAllFlags = 0x170;

// The most entries a list may hold.
inline constexpr std::size_t kACLMaxEntries = 128;

struct AccessControlEntry {
  std::uint32_t tag = kACLTagUndefined;
  std::uint32_t permissions = 0;
  std::uint32_t flags = 0;
  Uuid qualifier;

  friend bool operator==(const AccessControlEntry&, const AccessControlEntry&) = default;
};

// A list in memory: the entries in order. Being a value, it is freed with its
// owner (what acl_free does for the C interface).
struct AccessControlList {
  std::vector<AccessControlEntry> entries;

  friend bool operator==(const AccessControlList&, const AccessControlList&) = default;
};

// Position of an entry in its list.
using ACLEntryIndex = std::size_t;

// The membership UUID of a gid, and the gid of a membership UUID (none for a
// UUID of any other form).
Uuid groupMembershipUUID(gid_t gid);
std::optional<gid_t> gidOfGroupMembershipUUID(const Uuid& uuid);

// The record of a list, as kept with the item: a text, one line per entry
// after a header, numbers in hexadecimal.
//
//   kestrel-acl 1
//   allow 4B535447-0000-8000-8000-0000000001F3 0x3ffe 0x160
//   allow 4B535447-0000-8000-8000-0000000001F3 0x624 0x0
//
// The tag is "allow", "deny" or "undefined". Decoding accepts exactly this
// form and nothing else.
std::string encodeAccessControlList(const AccessControlList& acl);
std::optional<AccessControlList> decodeAccessControlList(std::string_view text);

class ExtendedACL {
 public:
  virtual ~ExtendedACL() = default;

  // --- Building a list (acl_init ... acl_set_qualifier) --------------------------------------

  // A new empty list with room for count entries (a hint; the list grows).
  // EINVAL for a negative count, ENOMEM beyond kACLMaxEntries.
  virtual int init(int count, AccessControlList* acl);
  // Appends an undefined entry. ENOMEM when the list is full.
  virtual int createEntry(AccessControlList* acl, ACLEntryIndex* entry);
  // The permission set of an entry, changed apart and set back. EINVAL for an
  // entry that is not in the list or for bits outside kACLAllPermissions.
  virtual int getPermset(const AccessControlList& acl, ACLEntryIndex entry, std::uint32_t* permset);
  virtual int addPerm(std::uint32_t* permset, std::uint32_t perm);
  virtual int setPermset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t permset);
  // The same for the flag set, bits within kACLAllFlags.
  virtual int getFlagset(const AccessControlList& acl, ACLEntryIndex entry, std::uint32_t* flagset);
  virtual int addFlag(std::uint32_t* flagset, std::uint32_t flag);
  virtual int setFlagset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t flagset);
  // EINVAL for a tag other than allow or deny.
  virtual int setTagType(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t tag);
  virtual int setQualifier(AccessControlList* acl, ACLEntryIndex entry, const Uuid& qualifier);

  // --- The platform ---------------------------------------------------------------------

  // The membership UUID of the named group; ENOENT when there is no such group.
  virtual int lookupGroupUUID(std::string_view groupName, Uuid* uuid) const = 0;

  // Sets the list on the item at path (type kACLTypeExtended; EINVAL for any
  // other), replacing the list it had; an empty list removes it. A symbolic
  // link at path is never followed: ELOOP.
  virtual int setFile(const char* path, int type, const AccessControlList& acl) = 0;

  // The same two for the item that fd refers to (a descriptor opened with
  // O_PATH | O_NOFOLLOW, or any other): nothing is looked up by path, so
  // nothing swapped in meanwhile is ever touched. ELOOP for a symbolic link
  // (EOPNOTSUPP for a mode change), as above.
  virtual int setDescriptor(int fd, int type, const AccessControlList& acl) = 0;
  virtual int setModeKeepingACLDescriptor(int fd, mode_t mode) = 0;

  // The list set on the item at path, not following a symbolic link. ENOENT
  // when the item has none.
  virtual int getFile(const char* path, int type, AccessControlList* acl) const = 0;

  // Sets the item's mode without following a symbolic link (EOPNOTSUPP for a
  // link, which has no mode of its own here), without taking away what its
  // list grants. Where the kernel enforces a list through the mode's group
  // bits, those bits keep what the list needs.
  virtual int setModeKeepingACL(const char* path, mode_t mode) = 0;
};

}  // namespace kestrel::platform
