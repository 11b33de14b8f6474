// One change of the protection classes of a data container's user data:
// Documents, Library, tmp and Tillbox, walked physically on the container's
// own file system. A pass holds the container's UUID lock for reading and
// first checks that the container still lies where it lay when the change
// was asked for. A locked device refuses changes into and out of class 1:
// the pass then reports that it must be retried, and with retryIfLocked the
// operation queues itself on the lock-state queue, which runs only while the
// device is unlocked, and tries again there (as often as the device locks
// again meanwhile). The completion runs once, after the last pass.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>

#include "daemon/errors.h"
#include "store/metadata.h"

namespace kestrel {

class KSTDataProtectionChangeOperation
    : public std::enable_shared_from_this<KSTDataProtectionChangeOperation> {
 public:
  // The operation type: a bit set.
  static constexpr std::uint32_t kChangeDirectories = 1;
  static constexpr std::uint32_t kChangeFiles = 2;
  // A file never gets a higher class number than it has.
  static constexpr std::uint32_t kNeverRaiseFileClass = 4;

  // Called once, on the lock-state queue, right before the first retry.
  using RetryStartBlock = std::function<void()>;
  // wasLocked: the device was locked and no retry was queued.
  using CompletionBlock = std::function<void(bool wasLocked, const KSTErrorRef& error)>;

  static std::shared_ptr<KSTDataProtectionChangeOperation>
  dataProtectionChangeOperationWithContainerMetadata(KSTMetadataRef metadata,
                                                     std::int32_t settingClass,
                                                     bool retryingIfLocked,
                                                     std::uint32_t changeType);

  void setRetryStartBlock(RetryStartBlock block);
  void setCompletionBlock(CompletionBlock block);

  // Runs a pass; then calls the completion, or queues the retry instead.
  void performChangeOperation();
  // One pass over the container. True with needToRetry when the device was
  // locked; false with the error that ended the pass (21: the container is
  // gone; 10: it moved; a POSIX error of the walk).
  bool _runChangeOperationNeedToRetry(bool* needToRetry, KSTErrorRef* withError);

  // Made only by dataProtectionChangeOperationWithContainerMetadata.
  struct Made {};
  KSTDataProtectionChangeOperation(Made, KSTMetadataRef metadata, std::int32_t newClass,
                                   bool retryingIfLocked, std::uint32_t changeType);

 private:
  RetryStartBlock retryStartBlock() const;
  CompletionBlock completionBlock() const;
  // Queues the next pass on the lock-state queue; false when there is none.
  bool queueRetry();

  const KSTMetadataRef dataContainerMetadata_;
  const std::int32_t newDataProtectionClass_;
  const bool retryIfLocked_;
  const std::uint32_t operationType_;
  std::atomic<bool> retried_{false};

  mutable std::mutex blocksMutex_;  // guards the two blocks
  RetryStartBlock retryStartBlock_;
  CompletionBlock completionBlock_;
};

}  // namespace kestrel
