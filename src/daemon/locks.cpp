#include "daemon/locks.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string_view>
#include <utility>

#include "daemon/invariant.h"
#include "daemon/log.h"
#include "platform/process.h"

namespace kestrel {

namespace {

// Owns one pthread reader/writer lock with default attributes.
class ReaderWriterLock {
 public:
  ReaderWriterLock() {
    const int status = pthread_rwlock_init(&lock_, nullptr);
    KST_INVARIANT(status == 0);
  }
  ~ReaderWriterLock() { pthread_rwlock_destroy(&lock_); }
  ReaderWriterLock(const ReaderWriterLock&) = delete;
  ReaderWriterLock& operator=(const ReaderWriterLock&) = delete;

  void lockForWriting() {
    const int status = pthread_rwlock_wrlock(&lock_);
    KST_INVARIANT(status == 0);
  }
  void lockForReading() {
    const int status = pthread_rwlock_rdlock(&lock_);
    KST_INVARIANT(status == 0);
  }
  void unlock() {
    const int status = pthread_rwlock_unlock(&lock_);
    KST_INVARIANT(status == 0);
  }

 private:
  pthread_rwlock_t lock_;
};

// One identifier that is locked or waited for. Made when the first locker
// arrives and destroyed when the last one releases it.
struct KSTIdentifierLock {
  ReaderWriterLock lock;
  // Holders and waiters of this record; guarded by gKSTLocks.mutex.
  std::uint64_t useCount = 0;
  // 0 free, -1 held by a writer, n > 0 held by n readers. Changed only by atomic
  // operations with full barriers, by the holders of `lock`.
  std::atomic<std::int32_t> lockState{0};
};

using KSTIdentifierLockMap = std::map<std::string, std::unique_ptr<KSTIdentifierLock>, std::less<>>;

// The process-wide lock state. `mutex` guards every other field and the map.
// It is always taken alone: a record's lock is awaited only after `mutex` has
// been released, and released while `mutex` is held.
struct KSTLocksState {
  std::mutex mutex;
  std::condition_variable allWritersCondition;
  std::condition_variable allReadersCondition;
  std::condition_variable identifierWritersCondition;
  std::condition_variable identifierReadersCondition;
  // Made on first use.
  std::unique_ptr<KSTIdentifierLockMap> identifierToLockMap;
  // Identifier locks held or being acquired. Raised before the record's lock is
  // taken, so that a writer of all identifiers also waits for lockers still
  // blocked on a record.
  std::uint32_t identifierReaderCount = 0;
  std::uint32_t identifierWriterCount = 0;
  // The lock on all identifiers: 0 free, -1 held by one writer, n > 0 held by n readers.
  std::int32_t allReaderWriterState = 0;
};

KSTLocksState gKSTLocks;

const char* modeName(bool forWriting) {
  return forWriting ? "writing" : "reading";
}

[[noreturn]] void unknownParameterType(const char* tag) {
  KSTLogTag(kLogError, tag, "Unknown parameter type!");
  platform::abortWithCrashMessage("Unknown parameter type!");
}

// The order of identifiers taken together: strings by character value; a value
// that is not a string compares equal to anything.
int compareIdentifiers(const PlistValue& a, const PlistValue& b) {
  const std::string* left = a.string();
  const std::string* right = b.string();
  if (left == nullptr || right == nullptr) return 0;
  return left->compare(*right);
}

// The elements of an array parameter, sorted (ascending or descending); aborts
// when the array holds anything but strings.
std::vector<std::string> sortedIdentifiers(const PlistArray& identifiers, bool ascending,
                                           const char* tag) {
  PlistArray sorted = identifiers;
  std::stable_sort(sorted.begin(), sorted.end(), [ascending](const auto& a, const auto& b) {
    const int order = compareIdentifiers(a, b);
    return ascending ? order < 0 : order > 0;
  });
  std::vector<std::string> result;
  result.reserve(sorted.size());
  for (const PlistValue& element : sorted) {
    const std::string* identifier = element.string();
    if (identifier == nullptr) unknownParameterType(tag);
    result.push_back(*identifier);
  }
  return result;
}

void take_one_lock(const std::string& identifier, bool forWriting) {
  KSTIdentifierLock* record = nullptr;
  {
    std::unique_lock lock(gKSTLocks.mutex);
    if (forWriting) {
      gKSTLocks.identifierWritersCondition.wait(lock,
                                                [] { return gKSTLocks.allReaderWriterState == 0; });
      ++gKSTLocks.identifierWriterCount;
    } else {
      gKSTLocks.identifierReadersCondition.wait(
          lock, [] { return gKSTLocks.allReaderWriterState != -1; });
      ++gKSTLocks.identifierReaderCount;
    }

    if (!gKSTLocks.identifierToLockMap) {
      gKSTLocks.identifierToLockMap = std::make_unique<KSTIdentifierLockMap>();
    }
    auto& slot = (*gKSTLocks.identifierToLockMap)[identifier];
    if (!slot) slot = std::make_unique<KSTIdentifierLock>();
    ++slot->useCount;
    record = slot.get();
  }

  KSTLog(kLogDebug, "Waiting to lock %@ for %s", identifier, modeName(forWriting));
  if (forWriting) {
    record->lock.lockForWriting();
    std::int32_t expected = 0;
    KST_INVARIANT(record->lockState.compare_exchange_strong(expected, -1));
  } else {
    record->lock.lockForReading();
    KST_INVARIANT(record->lockState.fetch_add(1) + 1 > 0);
  }
  KSTLog(kLogDebug, "Got lock on identifier %@", identifier);
}

void unlock_one_lock(const std::string& identifier) {
  std::lock_guard lock(gKSTLocks.mutex);
  KST_INVARIANT(gKSTLocks.identifierToLockMap != nullptr);
  KSTIdentifierLockMap& map = *gKSTLocks.identifierToLockMap;
  const auto found = map.find(identifier);
  KST_INVARIANT(found != map.end());
  KSTIdentifierLock& record = *found->second;
  KST_INVARIANT(record.lockState.load() != 0);

  if (record.lockState.load() == -1) {
    std::int32_t expected = -1;
    KST_INVARIANT(record.lockState.compare_exchange_strong(expected, 0));
    KST_INVARIANT(gKSTLocks.allReaderWriterState == 0);
    KST_INVARIANT(gKSTLocks.identifierWriterCount > 0);
    const std::uint32_t writersBefore = gKSTLocks.identifierWriterCount--;
    if (writersBefore == 1 && gKSTLocks.identifierReaderCount == 0) {
      gKSTLocks.allWritersCondition.notify_one();
    }
    if (gKSTLocks.identifierWriterCount == 0 && gKSTLocks.allReaderWriterState != -1) {
      gKSTLocks.allReadersCondition.notify_all();
    }
  } else {
    KST_INVARIANT(record.lockState.fetch_sub(1) - 1 >= 0);
    KST_INVARIANT(gKSTLocks.allReaderWriterState >= 0);
    KST_INVARIANT(gKSTLocks.identifierReaderCount > 0);
    --gKSTLocks.identifierReaderCount;
    if (gKSTLocks.allReaderWriterState == 0 && gKSTLocks.identifierReaderCount == 0 &&
        gKSTLocks.identifierWriterCount == 0) {
      gKSTLocks.allWritersCondition.notify_one();
    }
  }

  KST_INVARIANT(record.useCount > 0);
  --record.useCount;
  record.lock.unlock();
  KSTLog(kLogDebug, "Unlocked identifier %@", identifier);

  if (record.useCount == 0) {
    KSTLog(kLogDebug, "Destroying lock for identifier %@", identifier);
    KST_INVARIANT(record.lockState.load() == 0);
    map.erase(found);
  }
}

}  // namespace

void _lock_identifier(const PlistValue& identifier, bool forWriting) {
  if (const std::string* one = identifier.string()) {
    take_one_lock(*one, forWriting);
    return;
  }
  const PlistArray* many = identifier.array();
  if (many == nullptr) unknownParameterType("_lock_identifier");

  std::set<std::string, std::less<>> taken;
  for (const std::string& element : sortedIdentifiers(*many, true, "_lock_identifier")) {
    if (!taken.insert(element).second) continue;
    take_one_lock(element, forWriting);
  }
}

void _lock_identifier(const std::string& identifier, bool forWriting) {
  take_one_lock(identifier, forWriting);
}

void _lock_identifier(const char* identifier, bool forWriting) {
  if (identifier == nullptr) unknownParameterType("_lock_identifier");
  take_one_lock(identifier, forWriting);
}

void _lock_identifier(const std::vector<std::string>& identifiers, bool forWriting) {
  _lock_identifier(PlistValue(PlistArray(identifiers.begin(), identifiers.end())), forWriting);
}

void unlock_identifier(const PlistValue& identifier) {
  if (const std::string* one = identifier.string()) {
    unlock_one_lock(*one);
    return;
  }
  const PlistArray* many = identifier.array();
  if (many == nullptr) unknownParameterType("unlock_identifier");

  std::set<std::string, std::less<>> released;
  for (const std::string& element : sortedIdentifiers(*many, false, "unlock_identifier")) {
    if (!released.insert(element).second) continue;
    unlock_one_lock(element);
  }
}

void unlock_identifier(const std::string& identifier) {
  unlock_one_lock(identifier);
}

void unlock_identifier(const char* identifier) {
  if (identifier == nullptr) unknownParameterType("unlock_identifier");
  unlock_one_lock(identifier);
}

void unlock_identifier(const std::vector<std::string>& identifiers) {
  unlock_identifier(PlistValue(PlistArray(identifiers.begin(), identifiers.end())));
}

void _lock_all_identifiers(bool forWriting) {
  KSTLog(kLogDebug, "Waiting to lock all identifiers for %s", modeName(forWriting));
  std::unique_lock lock(gKSTLocks.mutex);
  if (forWriting) {
    gKSTLocks.allWritersCondition.wait(lock, [] {
      return gKSTLocks.identifierReaderCount == 0 && gKSTLocks.identifierWriterCount == 0 &&
             gKSTLocks.allReaderWriterState == 0;
    });
    gKSTLocks.allReaderWriterState = -1;
  } else {
    gKSTLocks.allReadersCondition.wait(lock, [] {
      return gKSTLocks.identifierWriterCount == 0 && gKSTLocks.allReaderWriterState != -1;
    });
    ++gKSTLocks.allReaderWriterState;
  }
  KSTLog(kLogDebug, "Locked all identifiers for %s", modeName(forWriting));
}

void unlock_all_identifiers() {
  {
    std::lock_guard lock(gKSTLocks.mutex);
    if (gKSTLocks.allReaderWriterState == -1) {
      gKSTLocks.allReaderWriterState = 0;
      gKSTLocks.allWritersCondition.notify_one();
      gKSTLocks.allReadersCondition.notify_all();
      gKSTLocks.identifierWritersCondition.notify_all();
      gKSTLocks.identifierReadersCondition.notify_all();
    } else {
      KST_INVARIANT(gKSTLocks.allReaderWriterState > 0);
      const std::int32_t readersBefore = gKSTLocks.allReaderWriterState--;
      if (readersBefore == 1) gKSTLocks.identifierWritersCondition.notify_all();
      if (gKSTLocks.allReaderWriterState == 0 && gKSTLocks.identifierReaderCount == 0 &&
          gKSTLocks.identifierWriterCount == 0) {
        gKSTLocks.allWritersCondition.notify_one();
      }
    }
  }
  KSTLog(kLogDebug, "Unlocked all identifiers");
}

std::size_t KSTLocksLiveRecordCount() {
  std::lock_guard lock(gKSTLocks.mutex);
  return gKSTLocks.identifierToLockMap ? gKSTLocks.identifierToLockMap->size() : 0;
}

// ---- Guards

KSTIdentifierLockGuard::KSTIdentifierLockGuard(PlistValue identifiers, bool forWriting)
    : identifiers_(std::move(identifiers)) {
  _lock_identifier(identifiers_, forWriting);
  held_ = true;
}

KSTIdentifierLockGuard::KSTIdentifierLockGuard(const std::string& identifier, bool forWriting)
    : KSTIdentifierLockGuard(PlistValue(identifier), forWriting) {}

// A null pointer names no identifier: it is refused like a parameter of another type.
KSTIdentifierLockGuard::KSTIdentifierLockGuard(const char* identifier, bool forWriting)
    : KSTIdentifierLockGuard(identifier != nullptr ? PlistValue(identifier) : PlistValue(false),
                             forWriting) {}

KSTIdentifierLockGuard::KSTIdentifierLockGuard(const std::vector<std::string>& identifiers,
                                               bool forWriting)
    : KSTIdentifierLockGuard(PlistValue(PlistArray(identifiers.begin(), identifiers.end())),
                             forWriting) {}

KSTIdentifierLockGuard::KSTIdentifierLockGuard(KSTIdentifierLockGuard&& other) noexcept
    : identifiers_(std::move(other.identifiers_)), held_(std::exchange(other.held_, false)) {}

KSTIdentifierLockGuard::~KSTIdentifierLockGuard() {
  unlock();
}

void KSTIdentifierLockGuard::unlock() {
  if (!held_) return;
  held_ = false;
  unlock_identifier(identifiers_);
}

KSTAllIdentifiersLockGuard::KSTAllIdentifiersLockGuard(bool forWriting) {
  _lock_all_identifiers(forWriting);
  held_ = true;
}

KSTAllIdentifiersLockGuard::KSTAllIdentifiersLockGuard(KSTAllIdentifiersLockGuard&& other) noexcept
    : held_(std::exchange(other.held_, false)) {}

KSTAllIdentifiersLockGuard::~KSTAllIdentifiersLockGuard() {
  unlock();
}

void KSTAllIdentifiersLockGuard::unlock() {
  if (!held_) return;
  held_ = false;
  unlock_all_identifiers();
}

}  // namespace kestrel
