// Death row. Containers and leftovers that are to go are first renamed into
// the death-row directory, so that they leave their class directory at once;
// the slow recursive removal of everything there runs later, one sweep at a
// time, on the death-row queue. An item that cannot be removed is moved to
// "/tmp" instead, so that no entry blocks the next sweep.
#include <cerrno>
#include <utility>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "platform/crash_point.h"
#include "platform/services.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

constexpr const char* kTempDirectory = "/tmp";
constexpr const char* kRemoveOrMoveTag = "_removeItemOrMoveToTempAtURL";
// Holders a move tries before it gives up on sweeps taking them away.
constexpr int kHolderAttempts = 8;

// The work of the members, free of any client: the sweep outlives the request
// that asked for it.
bool removeItemOrMoveToTemp(const KSTFileURL& url, KSTErrorRef* error) {
  KSTSetError(error, nullptr);
  const KSTFileManager& fileManager = KSTFileManager::defaultManager();
  KSTErrorRef removeError;
  if (fileManager.removeItemAtURL(url, &removeError)) return true;
  if (removeError && removeError->isPOSIXError(ENOENT)) return true;

  KSTLogTag(kLogDebug, kRemoveOrMoveTag, "Couldn't remove, so moving item to /tmp: %@ : %@", url,
            removeError);
  // Under its own name, in a holder of its own: items put aside by earlier
  // sweeps never stand in the way.
  const KSTFileURL temp(platform::services().root.resolve(kTempDirectory), true);
  KSTErrorRef moveError;
  if (const std::optional<KSTFileURL> holder =
          fileManager.createTemporaryDirectoryInDirectoryURL(temp, &moveError)) {
    const KSTFileURL destination = holder->appending(url.lastPathComponent(), url.isDirectory());
    if (fileManager.moveItemAtURL(url, destination, &moveError)) return true;
    fileManager.removeItemAtURL(*holder, nullptr);
  }
  KSTSetError(error, KST_ERROR_IN(kRemoveOrMoveTag, kKSTErrorMoveToTempFailed, moveError, true,
                                  "Failed to move dir: %@ to: %@", url, temp));
  return false;
}

// The sweep of deleteContainersOnDeathRowWithCompletion, run on the death-row queue.
constexpr const char* kSweepTag = "deleteContainersOnDeathRowWithCompletion";

std::uint64_t sweepDeathRow() {
  const KSTFileManager& fileManager = KSTFileManager::defaultManager();
  const KSTFileURL deathRow = KSTGlobalConfiguration::sharedInstance().deathrowDirectory();
  std::uint64_t code = kKSTSuccess;

  KSTErrorRef listError;
  const std::optional<std::vector<KSTFileURL>> items =
      fileManager.urlsForItemsInDirectoryAtURL(deathRow, &listError);
  if (!items) {
    if (listError && listError->isPOSIXError(ENOENT)) return kKSTSuccess;
    KSTErrorRef failure =
        KST_ERROR_IN(kSweepTag, kKSTErrorDeleteFailed, listError, true,
                     "Failed to get items for deletion: %@ : %@", deathRow, listError);
    KSTHandOverCode(failure, &code);
    return code;
  }

  for (const KSTFileURL& item : *items) {
    KSTErrorRef itemError;
    if (removeItemOrMoveToTemp(item, &itemError)) continue;
    KSTErrorRef failure = KST_ERROR_IN(kSweepTag, kKSTErrorDestroyFailed, itemError, true,
                                       "Failed to destroy item at: %@", item);
    KSTHandOverCode(failure, &code);
  }
  return code;
}

}  // namespace

bool KSTClientConnection::_removeItemOrMoveToTempAtURL(const KSTFileURL& url, KSTErrorRef* error) {
  return removeItemOrMoveToTemp(url, error);
}

bool KSTClientConnection::_moveItemAtURLToDeathRow(const KSTFileURL& url, bool isDir,
                                                   bool startDeletionThread, KSTErrorRef* error) {
  KSTSetError(error, nullptr);
  const KSTFileManager& fileManager = KSTFileManager::defaultManager();
  const KSTFileURL deathRow = KSTGlobalConfiguration::sharedInstance().deathrowDirectory();

  // A holder of its own, so that two items of the same name never collide.
  // A sweep running meanwhile may take a fresh, still empty holder with it
  // before the item arrives; the rename then finds no destination, and the
  // item, still in place, gets a new holder.
  for (int attempt = 1;; ++attempt) {
    KSTErrorRef createError;
    const std::optional<KSTFileURL> holder =
        fileManager.createTemporaryDirectoryInDirectoryURL(deathRow, &createError);
    if (!holder) {
      KSTSetError(error, KST_ERROR(kKSTErrorDeathRowMoveFailed, createError, true,
                                   "Failed to create unique directory at: %@", url));
      return false;
    }

    KST_CRASH_POINT("death-row.holder-made");
    const KSTFileURL destination = holder->appending(url.lastPathComponent(), isDir);
    KSTErrorRef moveError;
    if (fileManager.moveItemAtURL(url, destination, &moveError)) {
      KST_CRASH_POINT("death-row.moved");
      if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
      return true;
    }
    if (moveError && moveError->isPOSIXError(ENOENT)) {
      // Nothing to move. The empty holder goes with the next sweep.
      if (fileManager.itemDoesNotExistAtURL(url)) return true;
      if (attempt < kHolderAttempts) continue;
    }
    KSTSetError(error, KST_ERROR(kKSTErrorDeathRowMoveFailed, moveError, true,
                                 "Failed to move item at: %@ to: %@", url, destination));
    return false;
  }
}

void KSTClientConnection::deleteContainersOnDeathRowWithCompletion(
    std::function<void(std::uint64_t code)> completion) {
  auto sweep = [completion = std::move(completion)] {
    std::uint64_t code = kKSTSuccess;
    KST_CATCH_EXCEPTIONS(&code, [&] { code = sweepDeathRow(); });
    if (completion) completion(code);
  };
  std::shared_ptr<platform::DispatchQueue> queue = KSTDeathRowQueue();
  if (!queue) {
    // No thread could be started for the queue: the background pool still
    // keeps the sweep off the caller's thread.
    KSTLog(kLogError, "No death-row queue, sweeping on the background queue");
    queue = platform::DispatchQueue::global(platform::QueuePriority::Background);
  }
  KSTDispatchAsyncWithTransaction(queue, std::move(sweep));
}

}  // namespace kestrel
