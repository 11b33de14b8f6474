// How much storage a container takes: the allocated sizes of every file
// beneath its directory, each hard-linked file once, no symbolic link
// followed and no other file system entered. Directories themselves add
// nothing. Bundle containers do not change once installed, so their figure
// is kept in their info dictionary and read back on later requests; data
// containers are walked every time.
#include <cerrno>
#include <cstring>
#include <deque>
#include <string>
#include <unordered_set>
#include <vector>

#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "operations/container_address.h"
#include "platform/entry_scan.h"
#include "store/file_manager.h"

namespace kestrel {

namespace {

constexpr const char* kStaticDiskUsageKey = "com.zorvane.Tessel.StaticDiskUsage";

constexpr std::uint32_t kWalkAttributes =
    platform::kEntryAttributeType | platform::kEntryAttributeFileId |
    platform::kEntryAttributeLinkCount | platform::kEntryAttributeAllocatedSize;

}  // namespace

std::uint64_t KSTFileManager::diskUsageForURL(const KSTFileURL& url) const {
  if (url.empty()) {
    KSTLog(kLogError, "Failed to get path to url %@", url);
    return 0;
  }
  // Breadth first: only directory paths wait in the queue, and the one
  // buffer serves every read of the walk.
  std::deque<std::string> queue{url.path()};
  std::unordered_set<std::uint64_t> seen;
  std::uint64_t total = 0;
  std::vector<std::byte> buffer(platform::kEntryScanBufferSize);

  while (!queue.empty()) {
    const std::string path = std::move(queue.front());
    queue.pop_front();
    platform::EntryScanner scanner;
    if (const int error = scanner.open(path.c_str()); error != 0) {
      KSTLog(kLogError, "Failed to open directory %@ : %s", path, std::strerror(error));
      continue;
    }
    std::uint64_t entry = 0;
    const auto count = [&](const platform::ScannedEntry& item) {
      ++entry;
      if (item.error != 0) {
        KSTLog(kLogError, "Got error %s while processing entry %llu in %@",
               std::strerror(item.error), entry, path);
        return;
      }
      if (item.otherFileSystem) {
        KSTLog(kLogDebug, "Skipping %@/%s: it lies on another file system", path, item.name);
        return;
      }
      if ((item.returned & platform::kEntryAttributeType) &&
          item.type == platform::EntryType::Directory) {
        std::string child;
        child.reserve(path.size() + 1 + item.name.size());
        child.append(path).append("/").append(item.name);
        queue.push_back(std::move(child));
        return;
      }
      // Files and everything else that is not a directory, symbolic links
      // included (their own storage, never their target's).
      const bool singleLink =
          (item.returned & platform::kEntryAttributeLinkCount) && item.linkCount == 1;
      if (!singleLink && (item.returned & platform::kEntryAttributeFileId) &&
          !seen.insert(item.fileId).second) {
        KSTLog(kLogDebug, "Skipping hardlinked file at %@/%s", path, item.name);
        return;
      }
      if (item.returned & platform::kEntryAttributeAllocatedSize) total += item.allocatedSize;
    };
    for (;;) {
      const int read = scanner.read(buffer);
      if (read < 0) {
        KSTLog(kLogError, "entryscan on entry %llu in %@ returned error %s", entry, path,
               std::strerror(errno));
        break;
      }
      if (read == 0) break;
      scanner.forEachEntry(kWalkAttributes, count);
    }
  }
  return total;
}

std::uint64_t KSTClientConnection::diskUsageForUserId(std::uint32_t userId,
                                                      const std::optional<platform::Uuid>& uuid,
                                                      const std::optional<std::string>& identifier,
                                                      KSTContainerClass containerClass,
                                                      std::uint64_t* withError) {
  const char* const function = __func__;
  // Held for writing across the read of the kept figure, the walk and the
  // store, which therefore run with useLocking unset.
  return KSTOnCachedContainer(
      function, userId, uuid, identifier, containerClass, KSTContainerLock::Writing, withError,
      [&](const KSTMetadataRef& container) -> std::uint64_t {
        const bool keepsFigure = KSTIsBundleClass(containerClass);
        if (keepsFigure) {
          std::uint64_t code = kKSTSuccess;
          const std::optional<PlistValue> kept = infoValueForKey(
              kStaticDiskUsageKey, userId, uuid, identifier, containerClass, false, &code);
          if (!kept && code != kKSTErrorInfoValueNotFound) {
            KSTLogTag(
                kLogError, function,
                "Error looking up info value for userId: %u, identifier: %@, Class: %llu: %llu",
                userId, identifier, containerClass, code);
          }
          if (kept) {
            if (const std::optional<std::uint64_t> bytes = kept->unsignedInteger()) return *bytes;
          }
        }

        const std::uint64_t usage =
            KSTFileManager::defaultManager().diskUsageForURL(container->url());

        if (keepsFigure) {
          std::uint64_t code = kKSTSuccess;
          setInfoValue(PlistValue(usage), kStaticDiskUsageKey, userId, uuid, identifier,
                       containerClass, false, &code);
          if (code != kKSTSuccess) {
            KSTLogTag(kLogError, function,
                      "Error setting info value for userId: %u, identifier: %@, Class: %llu: %llu",
                      userId, identifier, containerClass, code);
          }
        }
        return usage;
      });
}

}  // namespace kestrel
