#include "protection/data_protection_change_operation.h"

#include <fts.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "daemon/log.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

// Physical (links are items, never followed), no change of the working
// directory, never into another file system, in directory order.
constexpr int kWalkOptions = FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV;
// Items in class 2 keep it; no change sets it.
constexpr KSTProtectionClass kUntouchedClass{2};

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

struct FtsCloser {
  void operator()(FTS* fts) const { ::fts_close(fts); }
};
using FtsHandle = std::unique_ptr<FTS, FtsCloser>;

// The walk of one pass: which items change, and to what.
class ClassWalk {
 public:
  ClassWalk(const char* function, std::int32_t newClass, std::uint32_t operationType)
      : function_(function), newClass_(newClass), operationType_(operationType) {}

  // Visits every item beneath the paths; false with the error that ended it.
  bool run(const std::vector<std::string>& paths, const KSTFileURL& container, KSTErrorRef* error) {
    std::vector<char*> roots;
    for (const std::string& path : paths) roots.push_back(const_cast<char*>(path.c_str()));
    roots.push_back(nullptr);
    errno = 0;
    const FtsHandle walk(::fts_open(roots.data(), kWalkOptions, nullptr));
    if (!walk) {
      const int opened = errno;
      *error = KST_POSIX_ERROR_IN(function_, opened, "fts_open failed for %@ : %s", container,
                                  errnoText(opened));
      return false;
    }
    for (;;) {
      errno = 0;
      FTSENT* entry = ::fts_read(walk.get());
      if (entry == nullptr) break;
      if (!visit(entry, error)) return false;
    }
    if (const int stopped = errno; stopped != 0) {
      *error = KST_POSIX_ERROR_IN(function_, stopped, "fts_read failed for %@ : %s", container,
                                  errnoText(stopped));
      return false;
    }
    return true;
  }

 private:
  bool visit(FTSENT* entry, KSTErrorRef* error) {
    switch (entry->fts_info) {
      case FTS_D:
        if (entry->fts_level == FTS_ROOTLEVEL) rootDevice_ = entry->fts_statp->st_dev;
        return true;
      case FTS_SL:
      case FTS_SLNONE:
      case FTS_DEFAULT:
        return true;
      case FTS_DP:
        // A directory on another file system (a mount point) is not ours:
        // the walk did not enter it, and its class stays as it is too.
        if ((operationType_ & KSTDataProtectionChangeOperation::kChangeDirectories) == 0 ||
            entry->fts_statp->st_dev != rootDevice_) {
          return true;
        }
        return change(
            entry, KSTProtectionClass{newClass_},
            [](KSTProtectionClass current) { return current != kUntouchedClass; }, error);
      case FTS_F: {
        if ((operationType_ & KSTDataProtectionChangeOperation::kChangeFiles) == 0) return true;
        // A file is never left in class 0: it gets 3 instead.
        const KSTProtectionClass target{newClass_ == 0 ? 3 : newClass_};
        const bool neverRaise =
            (operationType_ & KSTDataProtectionChangeOperation::kNeverRaiseFileClass) != 0;
        return change(
            entry, target,
            [target, neverRaise](KSTProtectionClass current) {
              return current != target && current != kUntouchedClass &&
                     !(neverRaise && target > current);
            },
            error);
      }
      default:
        KSTLogTag(kLogError, function_, "FTS returned error for %s : %s", entry->fts_path,
                  errnoText(entry->fts_errno));
        return true;
    }
  }

  template <typename Predicate>
  bool change(FTSENT* entry, KSTProtectionClass target, Predicate accepts, KSTErrorRef* error) {
    const KSTFileURL url(entry->fts_path, entry->fts_info == FTS_DP);
    const char* const function = function_;
    const auto predicate = [&](KSTProtectionClass current) {
      if (!accepts(current)) return false;
      KSTLogTag(kLogDebug, function, "Setting protection class of %s to %d", entry->fts_path,
                static_cast<std::int32_t>(target));
      return true;
    };
    KSTErrorRef failure;
    if (KSTFileManager::defaultManager().setDataProtectionClassOfItemAtURL(url, target, predicate,
                                                                           &failure)) {
      return true;
    }
    if (failure && failure->isPOSIXError(EBADF)) {
      KSTLogTag(kLogError, function_,
                "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@",
                static_cast<std::int32_t>(target), url, entry->fts_statp->st_mode, failure);
      return true;
    }
    *error = std::move(failure);
    return false;
  }

  const char* const function_;
  const std::int32_t newClass_;
  const std::uint32_t operationType_;
  dev_t rootDevice_ = 0;
};

}  // namespace

std::shared_ptr<KSTDataProtectionChangeOperation>
KSTDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    KSTMetadataRef metadata, std::int32_t settingClass, bool retryingIfLocked,
    std::uint32_t changeType) {
  return std::make_shared<KSTDataProtectionChangeOperation>(
      Made{}, std::move(metadata), settingClass, retryingIfLocked, changeType);
}

KSTDataProtectionChangeOperation::KSTDataProtectionChangeOperation(Made, KSTMetadataRef metadata,
                                                                   std::int32_t newClass,
                                                                   bool retryingIfLocked,
                                                                   std::uint32_t changeType)
    : dataContainerMetadata_(std::move(metadata)),
      newDataProtectionClass_(newClass),
      retryIfLocked_(retryingIfLocked),
      operationType_(changeType) {}

void KSTDataProtectionChangeOperation::setRetryStartBlock(RetryStartBlock block) {
  const std::lock_guard lock(blocksMutex_);
  retryStartBlock_ = std::move(block);
}

void KSTDataProtectionChangeOperation::setCompletionBlock(CompletionBlock block) {
  const std::lock_guard lock(blocksMutex_);
  completionBlock_ = std::move(block);
}

KSTDataProtectionChangeOperation::RetryStartBlock
KSTDataProtectionChangeOperation::retryStartBlock() const {
  const std::lock_guard lock(blocksMutex_);
  return retryStartBlock_;
}

KSTDataProtectionChangeOperation::CompletionBlock
KSTDataProtectionChangeOperation::completionBlock() const {
  const std::lock_guard lock(blocksMutex_);
  return completionBlock_;
}

void KSTDataProtectionChangeOperation::performChangeOperation() {
  const KSTMetadata& container = *dataContainerMetadata_;
  bool needToRetry = false;
  KSTErrorRef error;
  if (!_runChangeOperationNeedToRetry(&needToRetry, &error)) {
    needToRetry = false;
    KSTLog(kLogNotice,
           "Operation to update protection classes for user: %u, id: %@, containerClass: %llu to "
           "class %d failed with error %@",
           container.uid(), container.identifier(), container.containerClass(),
           newDataProtectionClass_, error);
  }
  if (needToRetry) {
    if (retryIfLocked_) {
      KSTLog(kLogNotice,
             "Retrying container protection update to %d on next unlock for user: %u, id: %@, "
             "containerClass: %llu",
             newDataProtectionClass_, container.uid(), container.identifier(),
             container.containerClass());
      if (queueRetry()) return;  // the completion comes with a later pass
    }
    error = KST_ERROR(kKSTErrorDeviceLocked, error, true,
                      "Tried to update user: %u, id: %@, containerClass: %llu to protection class "
                      "%d, but was locked and didn't retry",
                      container.uid(), container.identifier(), container.containerClass(),
                      newDataProtectionClass_);
  }
  if (const CompletionBlock completion = completionBlock()) completion(needToRetry, error);
}

bool KSTDataProtectionChangeOperation::queueRetry() {
  const std::shared_ptr<platform::DispatchQueue> queue = KSTLockStateQueue();
  if (!queue) {
    KSTLog(kLogError, "No lock-state queue: the protection update cannot wait for an unlock");
    return false;
  }
  KSTDispatchAsyncWithTransaction(queue, [self = shared_from_this()] {
    if (!self->retried_.exchange(true)) {
      if (const RetryStartBlock start = self->retryStartBlock()) start();
    }
    self->performChangeOperation();
  });
  return true;
}

bool KSTDataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needToRetry,
                                                                      KSTErrorRef* withError) {
  const char* const function = __func__;
  const KSTMetadata& expected = *dataContainerMetadata_;
  *needToRetry = false;
  KSTErrorRef failure;
  std::uint64_t code = kKSTSuccess;
  const bool walked = KST_CATCH_EXCEPTIONS(&code, false, [&] {
    const KSTIdentifierLockGuard lock(expected.uuid().string(), kKSTLockForReading);

    // Still there, and still where it was when the change was asked for.
    std::uint64_t lookupCode = kKSTSuccess;
    const KSTMetadataRef container =
        KSTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
            expected.uid(), expected.identifier(), false, expected.containerClass(), false, false,
            &lookupCode);
    if (!container) {
      failure = KST_ERROR_IN(function, kKSTErrorNotFound, nullptr, true,
                             "Failed to lookup container to set data protection for userId: %u, "
                             "identifier: %@, Class: %llu",
                             expected.uid(), expected.identifier(), expected.containerClass());
      return false;
    }
    const KSTFileURL url = container->url();
    if (url.path() != expected.url().path()) {
      failure = KST_ERROR_IN(function, kKSTErrorInvalidURL, nullptr, true,
                             "Cancelling data protection operation because container path "
                             "changed on disk. This indicates the app may have been updated and "
                             "changed its protection level.");
      return false;
    }

    std::vector<std::string> items;
    for (const std::string& name : KSTGlobalConfiguration::appUserDataItemNames()) {
      const KSTFileURL item = url.appending(name, true);
      if (KSTFileManager::defaultManager().itemExistsAtURL(item)) items.push_back(item.path());
    }
    if (items.empty()) return true;
    return ClassWalk(function, newDataProtectionClass_, operationType_).run(items, url, &failure);
  });
  if (code != kKSTSuccess) {
    // The exception was reported as it was caught.
    failure = KST_ERROR_IN(function, static_cast<std::int64_t>(code), nullptr, false,
                           "Protection update stopped by an exception");
  }
  if (walked) return true;
  // What a locked device answers: the pass is to be repeated after the next unlock.
  if (failure && failure->isPOSIXError(EPERM)) {
    *needToRetry = true;
    return true;
  }
  KSTSetError(withError, std::move(failure));
  return false;
}

}  // namespace kestrel
