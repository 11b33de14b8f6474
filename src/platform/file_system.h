// File-system services the file layer builds on: removing, making and copying
// trees, the immutable file flag, and reading and writing whole files. Every
// function works on paths (already beneath the filesystem root), never follows
// a symbolic link it walks over, and returns 0 or an errno value.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <vector>

namespace kestrel::platform {

// --- Trees ---------------------------------------------------------------------------------

// Called for each item that could not be removed, with the item's path and the
// errno of the failure (0 when it is not known). Returns true to go on with
// the next item, false to stop the removal.
using TreeRemoveErrorCallback = std::function<bool(const char* path, int error)>;

// Removes path and, when it is a directory, everything beneath it, contents
// first. Symbolic links are removed, never followed; other file systems
// mounted beneath path are not entered. Returns 0 when the walk finished (items
// handed to the callback, which said to go on, count as finished), ENOENT when
// path does not exist, else the errno that stopped the removal: the failure of
// an item when there is no callback or the callback said to stop, or a failure
// of the walk itself.
int treeRemove(const char* path, const TreeRemoveErrorCallback& onItemError);

// Makes the directory path and every missing parent, each with mode (less the
// umask). EEXIST when path exists already (whatever it is), ENOTDIR when a
// parent is not a directory, else 0 or the errno of the failure.
int makePath(const char* path, mode_t mode);

// Copies a file, symbolic link, special file or directory tree at from to to:
// contents, mode, owner and group, extended attributes (trusted.* included) and
// POSIX ACLs (access and default), and access and modification times. No
// symbolic link is followed at the source or the destination; links are copied
// as links. to must not exist (EEXIST). Hard links are copied as separate
// files. A directory cannot be copied into itself (EINVAL). On failure the
// part already copied is left in place.
int copyTree(const char* from, const char* to);

// --- Confined resolution -------------------------------------------------------------------

// Opens relativePath beneath the directory baseFd with flags (O_CLOEXEC is
// added): the resolution may never leave that directory, by "..", an
// absolute or escaping symbolic link, a magic link or a mount point
// (openat2 with RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV),
// whatever is renamed or swapped meanwhile. An empty relativePath opens
// baseFd's directory itself. EXDEV or ELOOP for a path that would leave it.
// Where openat2 is refused (a kernel before 5.6, or a system-call filter that
// cannot inspect its flags, as systemd's RestrictSUIDSGID=), the path is
// walked one name at a time instead (linux/open_beneath_linux.h), which
// follows no link at all.
int openBeneath(int baseFd, const char* relativePath, int flags, int* fd);

// --- File flags ----------------------------------------------------------------------------

// The immutable flag: the file cannot be changed, renamed or unlinked while it
// is set (FS_IMMUTABLE_FL).
inline constexpr std::uint32_t kFileFlagUserImmutable = 0x2;
// The append-only flag: the file can only grow; it cannot be renamed or
// unlinked, and nothing can be removed from a directory that has it
// (FS_APPEND_FL).
inline constexpr std::uint32_t kFileFlagAppend = 0x4;
// Either flag keeps an item (or, on a directory, its entries) from going.
inline constexpr std::uint32_t kFileFlagsPreventingRemoval =
    kFileFlagUserImmutable | kFileFlagAppend;

// The file flags of path, without following a symbolic link.
int lstatFileFlags(const char* path, std::uint32_t* flags);

// Sets the file flags of path to flags, without following a symbolic link.
// Only kFileFlagUserImmutable and kFileFlagAppend are known; only regular
// files and directories carry flags (EOPNOTSUPP for anything else).
int lchflags(const char* path, std::uint32_t flags);

// --- Whole files ---------------------------------------------------------------------------

// Reads the whole regular file at path (not through a symbolic link: ELOOP),
// uncached: its pages are the first the kernel reclaims. EFBIG when it holds more than
// maxSize bytes, EISDIR or EINVAL when it is not a regular file.
int readWholeFile(const char* path, std::size_t maxSize, std::vector<std::uint8_t>* contents);

struct FileWriteOptions {
  // Write a temporary file beside path, flush it to disk and rename it over
  // path, so that readers see the old or the new contents, never a part.
  bool atomic = true;
  // The data-protection class the written file is born in (whatever the lock
  // state); none leaves it without one.
  std::optional<std::int32_t> protectionClass;
  mode_t mode = 0644;
};

// Writes contents to path (a symbolic link at path is replaced when atomic,
// refused with ELOOP otherwise). An atomic write that fails leaves path as it
// was and no temporary file behind.
int writeFile(const char* path, std::span<const std::uint8_t> contents,
              const FileWriteOptions& options);

}  // namespace kestrel::platform
