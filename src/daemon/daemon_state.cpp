#include "daemon/daemon_state.h"

#include <mutex>
#include <optional>
#include <vector>

#include "daemon/log.h"
#include "platform/never_destroyed.h"
#include "platform/services.h"

namespace kestrel {

namespace {

struct Queues {
  std::mutex mutex;
  std::shared_ptr<platform::DispatchQueue> deathRow;
  std::shared_ptr<platform::DispatchQueue> lockState;
  std::shared_ptr<platform::DispatchQueue> listener;
};

Queues& queues() {
  static platform::NeverDestroyed<Queues> q([](void* where) { return new (where) Queues(); });
  return *q;
}

// Touched only by the lock-state callback, on the main queue.
bool gIsLocked = false;

std::optional<std::vector<std::uint32_t>> _getListOfValidUserIds() {
  const auto& keyBag = platform::services().keyBag;
  if (!keyBag) return std::nullopt;
  std::optional<platform::UserTypeInfo> info = keyBag->userTypeInfo();
  if (!info) return std::nullopt;
  if (info->deviceMode != platform::DeviceMode::MultiUser) return std::nullopt;
  std::string error;
  std::optional<std::vector<std::uint32_t>> sessions = keyBag->userSessionIds(&error);
  if (!sessions) {
    KSTLog(kLogError, "Failed to get user sessions: %@", error);
    return std::nullopt;
  }
  return sessions;
}

}  // namespace

std::shared_ptr<platform::DispatchQueue> KSTDeathRowQueue() {
  std::lock_guard lock(queues().mutex);
  // Work can be sent to death row before start-up made the queues (tools and
  // tests that run no start-up): the queue is made here then, as start-up makes it.
  if (!queues().deathRow) {
    queues().deathRow = platform::DispatchQueue::createSerial(kKSTDeathRowQueueLabel);
    if (queues().deathRow) {
      queues().deathRow->setTarget(
          platform::DispatchQueue::global(platform::QueuePriority::Background));
    }
  }
  return queues().deathRow;
}

std::shared_ptr<platform::DispatchQueue> KSTLockStateQueue() {
  std::lock_guard lock(queues().mutex);
  return queues().lockState;
}

std::shared_ptr<platform::DispatchQueue> KSTListenerQueue() {
  std::lock_guard lock(queues().mutex);
  return queues().listener;
}

bool KSTCreateWorkQueues() {
  auto deathRow = platform::DispatchQueue::createSerial(kKSTDeathRowQueueLabel);
  auto lockState = platform::DispatchQueue::createSerial(kKSTLockStateQueueLabel);
  std::lock_guard lock(queues().mutex);
  queues().deathRow = deathRow;
  queues().lockState = lockState;
  return deathRow && lockState;
}

void KSTSetListenerQueue(std::shared_ptr<platform::DispatchQueue> queue) {
  std::lock_guard lock(queues().mutex);
  queues().listener = std::move(queue);
}

void KSTLockStateChanged() {
  const int state = platform::services().keyBag->lockState();
  KSTLogTag(kLogDebug, "KSTLockStateChanged", "LockState=%d", state);
  if (state != platform::KeyBag::kLocked && state != platform::KeyBag::kUnlocked) return;
  auto queue = KSTLockStateQueue();
  if (state == platform::KeyBag::kLocked && !gIsLocked) {
    queue->suspend();
  } else if (state == platform::KeyBag::kUnlocked && gIsLocked) {
    queue->resume();
  }
  gIsLocked = state == platform::KeyBag::kLocked;
}

bool KSTIsLocked() {
  return gIsLocked;
}

void KSTDispatchAsyncWithTransaction(const std::shared_ptr<platform::DispatchQueue>& queue,
                                     std::function<void()> block) {
  auto keepAlive = platform::services().keepAlive;
  if (keepAlive) keepAlive->begin();
  queue->async([keepAlive, block = std::move(block)] {
    // The transaction ends when the block returns, also when it throws.
    struct EndTransaction {
      std::shared_ptr<platform::KeepAlive> keepAlive;
      ~EndTransaction() {
        if (keepAlive) keepAlive->end();
      }
    } end{keepAlive};
    block();
  });
}

void KSTForEachValidUserId(const std::function<void(std::uint32_t userId)>& block) {
  static std::once_flag once;
  static std::optional<std::vector<std::uint32_t>> validUserIds;
  std::call_once(once, [] { validUserIds = _getListOfValidUserIds(); });
  if (!validUserIds) {
    block(kKSTDefaultMobileUserId);
    return;
  }
  for (std::uint32_t userId : *validUserIds) block(userId);
}

}  // namespace kestrel
