// Bulk directory reads on Linux: getdents64 fills the caller's buffer with as
// many directory records as fit, and each entry's attributes come from one
// statx relative to the directory's descriptor, asking only for what the
// caller needs.
#include "platform/entry_scan.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace kestrel::platform {

namespace {

// The fixed part of a getdents64 record: inode, offset, record length, type,
// then the name and its terminating zero byte.
constexpr std::size_t kRecordLengthOffset = 16;
constexpr std::size_t kRecordNameOffset = 19;

std::uint16_t recordLength(const std::byte* record) {
  std::uint16_t length;
  std::memcpy(&length, record + kRecordLengthOffset, sizeof length);
  return length;
}

const char* recordName(const std::byte* record) {
  return reinterpret_cast<const char*>(record + kRecordNameOffset);
}

bool isDotOrDotDot(const char* name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

// The records of a batch that name real entries.
int countEntries(std::span<const std::byte> batch) {
  int count = 0;
  for (std::size_t at = 0; at + kRecordNameOffset < batch.size();) {
    const std::uint16_t length = recordLength(batch.data() + at);
    if (length == 0) break;
    if (!isDotOrDotDot(recordName(batch.data() + at))) ++count;
    at += length;
  }
  return count;
}

unsigned statxMask(std::uint32_t attributes) {
  unsigned mask = 0;
  if (attributes & kEntryAttributeType) mask |= STATX_TYPE;
  if (attributes & kEntryAttributeFileId) mask |= STATX_INO;
  if (attributes & kEntryAttributeLinkCount) mask |= STATX_NLINK;
  if (attributes & kEntryAttributeAllocatedSize) mask |= STATX_BLOCKS;
  return mask;
}

EntryType entryType(mode_t mode) {
  switch (mode & S_IFMT) {
    case S_IFREG:
      return EntryType::Regular;
    case S_IFDIR:
      return EntryType::Directory;
    case S_IFLNK:
      return EntryType::SymbolicLink;
    default:
      return EntryType::Other;
  }
}

std::uint64_t deviceOf(const struct statx& attributes) {
  return makedev(attributes.stx_dev_major, attributes.stx_dev_minor);
}

constexpr int kStatxFlags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_SYNC_AS_STAT;

}  // namespace

int EntryScanner::open(const char* path) {
  directory_.reset(::open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  batch_ = {};
  if (!directory_) return errno;
  struct statx own {};
  if (::statx(directory_.get(), "", AT_EMPTY_PATH | kStatxFlags, STATX_TYPE, &own) != 0) {
    const int error = errno;
    directory_.reset();
    return error;
  }
  device_ = deviceOf(own);
  return 0;
}

int EntryScanner::read(std::span<std::byte> buffer) {
  batch_ = {};
  if (!directory_) {
    errno = EBADF;
    return -1;
  }
  // A read that holds only "." and ".." is not the end: read on.
  for (;;) {
    const long filled = ::syscall(SYS_getdents64, directory_.get(), buffer.data(), buffer.size());
    if (filled < 0) return -1;
    if (filled == 0) return 0;
    batch_ = buffer.first(static_cast<std::size_t>(filled));
    if (const int count = countEntries(batch_); count > 0) return count;
  }
}

void EntryScanner::forEachEntry(std::uint32_t attributes,
                                const std::function<void(const ScannedEntry&)>& visit) const {
  const unsigned mask = statxMask(attributes);
  for (std::size_t at = 0; at + kRecordNameOffset < batch_.size();) {
    const std::byte* record = batch_.data() + at;
    const std::uint16_t length = recordLength(record);
    if (length == 0) break;
    at += length;
    const char* name = recordName(record);
    if (isDotOrDotDot(name)) continue;

    ScannedEntry entry;
    entry.name = name;
    struct statx found {};
    if (::statx(directory_.get(), name, kStatxFlags, mask, &found) != 0) {
      entry.error = errno;
      visit(entry);
      continue;
    }
    if (found.stx_mask & STATX_TYPE) {
      entry.returned |= kEntryAttributeType;
      entry.type = entryType(found.stx_mode);
    }
    if (found.stx_mask & STATX_INO) {
      entry.returned |= kEntryAttributeFileId;
      entry.fileId = found.stx_ino;
    }
    if (found.stx_mask & STATX_NLINK) {
      entry.returned |= kEntryAttributeLinkCount;
      entry.linkCount = found.stx_nlink;
    }
    if (found.stx_mask & STATX_BLOCKS) {
      entry.returned |= kEntryAttributeAllocatedSize;
      entry.allocatedSize = found.stx_blocks * 512;
    }
    entry.returned &= attributes;
    entry.otherFileSystem = deviceOf(found) != device_;
#ifdef STATX_ATTR_MOUNT_ROOT
    // A bind mount of the same file system has the same device.
    if (found.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) {
      entry.otherFileSystem =
          entry.otherFileSystem || (found.stx_attributes & STATX_ATTR_MOUNT_ROOT);
    }
#endif
    visit(entry);
  }
}

}  // namespace kestrel::platform
