// Bulk directory reads: the entries of one open directory, many per system
// call, each with the few attributes a walk over a tree needs. A scanner owns
// the directory's descriptor; the caller owns the buffer the entries are read
// into and reuses it for every directory of its walk, so that reading a large
// tree allocates nothing per directory or per entry.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>
#include <string_view>

#include "platform/unique_fd.h"

namespace kestrel::platform {

// What one read may fill: a walk allocates one such buffer for all its
// directories.
inline constexpr std::size_t kEntryScanBufferSize = 32768;

enum class EntryType : std::uint8_t { Unknown, Regular, Directory, SymbolicLink, Other };

// The attributes an entry can carry; `ScannedEntry::returned` says which of
// them were read.
enum EntryAttribute : std::uint32_t {
  kEntryAttributeType = 1u << 0,
  kEntryAttributeFileId = 1u << 1,
  kEntryAttributeLinkCount = 1u << 2,
  kEntryAttributeAllocatedSize = 1u << 3,
};

struct ScannedEntry {
  std::uint32_t returned = 0;  // EntryAttribute bits
  int error = 0;               // the errno of reading the entry's attributes; 0 when none
  // The entry's name, inside the caller's buffer; valid until the next read.
  // "." and ".." are never reported.
  std::string_view name;
  EntryType type = EntryType::Unknown;
  std::uint64_t fileId = 0;         // inode number
  std::uint64_t linkCount = 0;      // hard links
  std::uint64_t allocatedSize = 0;  // bytes of storage allocated to it
  // The entry lies on another file system than the directory scanned (it is
  // a mount point, or something mounted over a name).
  bool otherFileSystem = false;
};

class EntryScanner {
 public:
  // Opens path read-only as a directory without following a symbolic link at
  // its last component; 0 or the errno of the failure.
  int open(const char* path);

  // Reads the next entries of the directory into buffer: how many there are
  // (at least one), 0 at the end of the directory, -1 with errno set.
  int read(std::span<std::byte> buffer);

  // Calls visit for each entry of the last read, in directory order, with the
  // attributes asked for (EntryAttribute bits). No symbolic link is followed
  // and no automount is triggered.
  void forEachEntry(std::uint32_t attributes,
                    const std::function<void(const ScannedEntry&)>& visit) const;

 private:
  UniqueFd directory_;
  std::uint64_t device_ = 0;
  std::span<const std::byte> batch_;
};

}  // namespace kestrel::platform
