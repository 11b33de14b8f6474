// KSTFileManager: every file-system operation of the daemon. Stateless; its
// operations take file URLs, work on their paths with POSIX calls and report
// failure as POSIX-domain error objects (code = errno, the message, the
// function and line). Missing items are not failures where things are removed
// or tested: removal of a missing item succeeds, and it counts as absent.
// Symbolic links are never followed by traversal, listing, copy or removal.
//
// Its access-control-list, protection-class item and disk-usage operations
// live with the subsystems that use them.
#pragma once

#include <fts.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

#include "daemon/errors.h"
#include "platform/extended_acl.h"
#include "store/file_url.h"

namespace kestrel {

// A data-protection class of the platform: a small signed number saying when a
// file's contents may be read. A type of its own, so that a class is never
// taken for an owner; write KSTProtectionClass{0}.
enum class KSTProtectionClass : std::int32_t {};

// Class 4: the files stay readable while the device is locked. The daemon's
// own files are written in it ("data-protection class none").
inline constexpr KSTProtectionClass kKSTProtectionClassNone{4};
// Class 3: what an item that carries no class counts as, as a container
// that records no class does (items made by applications carry none).
inline constexpr KSTProtectionClass kKSTProtectionClassUnrecorded{3};
// All bits set (4294967295, -1): leave the class as it is.
inline constexpr KSTProtectionClass kKSTProtectionClassLeaveAlone{-1};
// Owner 0: leave the owner as it is.
inline constexpr uid_t kKSTOwnerLeaveAlone = 0;

// Called for each entry of a traversal (directories twice: before and after
// their contents). Returns false, with an error or none, to stop the walk.
using KSTTraversalVisitor = std::function<bool(FTSENT* entry, KSTErrorRef* error)>;

class KSTFileManager {
 public:
  // The one file manager of the process.
  static KSTFileManager& defaultManager();

  // Removes the item and everything beneath it. A missing item is success.
  bool removeItemAtURL(const KSTFileURL& url, KSTErrorRef* error) const;

  // Makes a directory (with its missing parents when asked) with the mode; an
  // existing directory keeps its mode. Then sets its protection class, unless
  // it is kKSTProtectionClassLeaveAlone, and its owner (uid and gid), unless
  // it is 0.
  bool createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories, mode_t mode,
                            uid_t owner, KSTProtectionClass protectionClass,
                            KSTErrorRef* error) const;
  bool createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories, mode_t mode,
                            uid_t owner, KSTErrorRef* error) const;
  bool createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories, mode_t mode,
                            KSTProtectionClass protectionClass, KSTErrorRef* error) const;
  bool createDirectoryAtURL(const KSTFileURL& url, bool withIntermediateDirectories, mode_t mode,
                            KSTErrorRef* error) const;

  // Copies a file or tree with its data, modes, owners, extended attributes
  // and ACLs; the destination must not exist. Without failIfSrcMissing a
  // missing source is success and nothing is done.
  bool _copyItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL, bool failIfSrcMissing,
                      KSTErrorRef* error) const;
  bool copyItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL, KSTErrorRef* error) const;
  bool copyItemIfExistsAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                             KSTErrorRef* error) const;

  // Renames; across file systems, copies and then removes the source. A move
  // that fails leaves nothing at the destination: a partial copy, or the copy
  // of a source that could not be removed (logged; the removal's error is the
  // move's), is removed again.
  bool _moveItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL, bool failIfSrcMissing,
                      KSTErrorRef* error) const;
  bool moveItemAtURL(const KSTFileURL& url, const KSTFileURL& toURL, KSTErrorRef* error) const;
  bool moveItemIfExistsAtURL(const KSTFileURL& url, const KSTFileURL& toURL,
                             KSTErrorRef* error) const;

  // A new directory "temp.XXXXXX" (mode 0700) in the parent, owned by owner
  // unless that is 0.
  std::optional<KSTFileURL> createTemporaryDirectoryInDirectoryURL(const KSTFileURL& url,
                                                                   uid_t owner,
                                                                   KSTErrorRef* error) const;
  std::optional<KSTFileURL> createTemporaryDirectoryInDirectoryURL(const KSTFileURL& url,
                                                                   KSTErrorRef* error) const;

  // Walks the tree at url physically, on its own file system, calling the
  // visitor for each entry. True only when every entry was visited.
  bool _traverseDirectory(const KSTFileURL& url, KSTErrorRef* error,
                          const KSTTraversalVisitor& withBlock) const;

  // The items of a directory, in directory order, without those whose name
  // begins with "."; each URL is marked as a directory when the item is one.
  std::optional<std::vector<KSTFileURL>> urlsForItemsInDirectoryAtURL(const KSTFileURL& url,
                                                                      KSTErrorRef* error) const;

  bool itemExistsAtURL(const KSTFileURL& url) const;
  bool itemDoesNotExistAtURL(const KSTFileURL& url) const;

  // Flushes to disk every directory of the tree at url, each after what lies
  // beneath it: names, owners, modes and ACLs (what files hold is their
  // writers' to flush). Stops at the first failure.
  bool synchronizeTreeAtURL(const KSTFileURL& url, KSTErrorRef* error) const;
  // Flushes the directory at url and every directory above it up to, not
  // including, the filesystem root, so that a directory made on the way
  // stays too.
  bool synchronizeDirectoryAndAncestorsAtURL(const KSTFileURL& url, KSTErrorRef* error) const;

  // Gives every item of the tree (metadata files excepted) the owner and group,
  // and mode 0755 (directories and executables) or 0644.
  bool standardizeOwnershipAtURL(const KSTFileURL& url, uid_t toUID, gid_t GID,
                                 KSTErrorRef* error) const;

  // Logs every item of the tree at error level (used for orphaned data).
  void printDirectoryStructureAtURL(const KSTFileURL& url) const;

  // --- Disk usage (operations/disk_usage.cpp) ---

  // The allocated bytes of every file beneath the directory at url, each
  // hard-linked file counted once; directories add nothing, symbolic links are
  // never followed and other file systems never entered. Whatever cannot be
  // read is logged and left out; 0 for a URL without a path.
  std::uint64_t diskUsageForURL(const KSTFileURL& url) const;

  // --- Path confinement (store/path_confinement.cpp) ---

  // The real path of url when it lies within ifChildOfURL once links and the
  // "/private" alias are resolved; nothing (logged) otherwise. No ".." is
  // accepted, a link at url itself only with a relative target that stays
  // within the base by its own components, and a path that does not exist
  // yet by its longest existing leading part.
  std::optional<KSTFileURL> realPathForURL(const std::optional<KSTFileURL>& url,
                                           const std::optional<KSTFileURL>& ifChildOfURL) const;
  // realpath(3); with allowNonExistentPathComponents, a missing tail is
  // joined onto the real path of what exists.
  std::optional<KSTFileURL> _realPathForURL(const KSTFileURL& url,
                                            bool allowNonExistentPathComponents) const;
  std::optional<KSTFileURL> _realPathWhatExistsInPath(const std::string& path) const;
  // Walks the components keeping a depth ("..": one down, a name: one up);
  // false as soon as it falls below the start.
  bool _validateSymlink(const std::optional<std::string>& path, std::int32_t withStartingDepth,
                        std::int32_t* andEndingDepth) const;

  // --- Access-control lists of system containers (codesigning/system_container_acls.cpp) ---
  // Each fails with error 63 naming the call that failed.

  // Appends one allow entry for the group "systemusers" with the permission and flag bits.
  bool _createSystemUserACEInACL(platform::AccessControlList* acl, std::uint32_t withPermissions,
                                 std::uint32_t andFlags, KSTErrorRef* error) const;
  // A new list with room for numACEs holding the directory entry (flags 0x160 when
  // inheritOnly, else 0x60) or the file entry.
  std::optional<platform::AccessControlList> _copySystemContainerACLWithNumACEs(
      int numACEs, bool isDir, bool inheritOnly, KSTErrorRef* error) const;
  // The two-entry list of a system container's top-level directory.
  std::optional<platform::AccessControlList> _copyTopLevelSystemContainerACL(
      KSTErrorRef* error) const;
  // Sets the top-level list on that one path.
  bool setTopLevelSystemContainerACLAtURL(const KSTFileURL& url, KSTErrorRef* error) const;
  // Gives every item of the tree (metadata files and symbolic links excepted) its
  // list, mode 0000 and owner and group -2; a system container's top directory
  // gets the top-level list and keeps its mode and owner. Failures on single
  // items are logged and skipped; only a failed walk fails the operation.
  bool standardizeACLsAtURL(const KSTFileURL& url, bool isSystemContainer,
                            KSTErrorRef* error) const;
  bool standardizeACLsForSystemContainerAtURL(const KSTFileURL& url, KSTErrorRef* error) const;
  // The same for the item named `name` in the open directory parentFd and
  // everything beneath it, reached through descriptors only: no path is
  // resolved again, no link followed, no other file system entered, so a
  // component swapped for a link meanwhile leads nowhere. displayPath names
  // the item in log lines.
  bool standardizeACLsBeneath(int parentFd, const std::string& name, bool isSystemContainer,
                              const std::string& displayPath, KSTErrorRef* error) const;
  // The above for every item of a class directory; a missing directory is success.
  bool standardizeAllSystemContainerACLsAtURL(const KSTFileURL& url, KSTErrorRef* error) const;

  // --- Protection classes of single items (protection/protection_class_items.cpp) ---
  // The item is opened without following a symbolic link; failures are
  // POSIX-domain errors with errno as their code ("Failed to open %s : %s",
  // "Failed to getclass of file %s: %s", "Failed to setclass(%d) on file
  // %s: %s"), not logged. An item without a class reads as
  // kKSTProtectionClassUnrecorded.

  bool dataProtectionClassOfItemAtURL(const KSTFileURL& url, KSTProtectionClass* protectionClass,
                                      KSTErrorRef* error) const;
  // With a predicate, the item's class is read first and, when the predicate
  // refuses it, the item is left as it is (success).
  bool setDataProtectionClassOfItemAtURL(
      const KSTFileURL& url, KSTProtectionClass toClass,
      const std::function<bool(KSTProtectionClass current)>& ifPredicate, KSTErrorRef* error) const;

 private:
  KSTFileManager() = default;
  bool moveAcrossFileSystems(const KSTFileURL& url, const KSTFileURL& toURL,
                             KSTErrorRef* error) const;
};

}  // namespace kestrel
