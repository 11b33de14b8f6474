// Access-control lists of system containers (class 12) and system group
// containers (class 13). Their items have mode 0000 and owner and group -2, so
// that the mode grants nothing; an allow entry for the group "systemusers" on
// every item grants access instead:
//
//   template                          entry  permissions      flags
//   top-level directory of a system   1      0x3FFE (16382)   0x160 (352): inherited by
//   container                                                 files and directories, inherit only
//                                     2      0x624 (1572)     none
//   any other directory               1      0x3FFE (16382)   0x60 (96): inherited by files
//                                                             and directories
//   anything else                     1      0x3FBE (16318)   0x10 (16): inherited
//
// On the top-level directory itself the group may add files and
// subdirectories and read and write extended attributes; entry 1 reaches only
// what is made inside it. Everything below carries full control for the group.
//
// The operations that set the templates belong to KSTFileManager
// (store/file_manager.h) and are defined with the templates in
// system_container_acls.cpp.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string_view>

#include "daemon/errors.h"
#include "platform/uuid.h"

namespace kestrel {

inline constexpr const char* kKSTSystemUsersGroupName = "systemusers";

// Full control for directories: every permission bit.
inline constexpr std::uint32_t kKSTSystemContainerDirectoryPermissions = 0x3FFE;
// Full control for files: every bit but delete child.
inline constexpr std::uint32_t kKSTSystemContainerFilePermissions = 0x3FBE;
// Top-level access: add file, add subdirectory, read and write extended attributes.
inline constexpr std::uint32_t kKSTSystemContainerTopLevelPermissions = 0x624;

inline constexpr std::uint32_t kKSTSystemContainerTopLevelInheritFlags = 0x160;
inline constexpr std::uint32_t kKSTSystemContainerDirectoryFlags = 0x60;
inline constexpr std::uint32_t kKSTSystemContainerFileFlags = 0x10;

// Owner and group of every item below the top level of a system container.
inline constexpr uid_t kKSTSystemContainerItemOwner = 4294967294U;
inline constexpr gid_t kKSTSystemContainerItemGroup = 4294967294U;

// The 16-byte membership UUID of the named group. Fails with error 63 naming
// the group and the errno of the lookup (ENOENT when there is no such group).
bool KSTLookupGroupUUID(std::string_view groupName, platform::Uuid* uuid, KSTErrorRef* error);

}  // namespace kestrel
