#include "daemon/locks.h"

#include <algorithm>
#include <atomic>
#include <bit>
#include <chrono>
#include <climits>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <memory>
#include <mutex>
#include <set>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "daemon/invariant.h"
#include "daemon/log.h"
#include "platform/process.h"

namespace kestrel {

namespace {

// Every lock here is held for a short while by requests that run on other
// cores, and a thread put to sleep on this virtual machine takes tens of
// microseconds to wake: so a locker that finds a lock taken tries again for a
// few microseconds before it sleeps.
constexpr auto kSpinBeforeSleeping = std::chrono::microseconds(20);

void cpuRelax() {
#if defined(__x86_64__) || defined(__i386__)
  __builtin_ia32_pause();
#else
  std::this_thread::yield();
#endif
}

// Calls `attempt` until it succeeds or the spin time is over.
template <typename Attempt>
bool spinFor(Attempt attempt) {
  if (attempt()) return true;
  const auto deadline = std::chrono::steady_clock::now() + kSpinBeforeSleeping;
  do {
    for (int i = 0; i < 32; ++i) cpuRelax();
    if (attempt()) return true;
  } while (std::chrono::steady_clock::now() < deadline);
  return false;
}

// The mutex of the lock state. Free, it is taken and released with one atomic
// instruction each, inline; a locker that finds it held spins for a while,
// then sleeps on its word.
class KSTStateMutex {
 public:
  void lock() {
    if (!try_lock()) [[unlikely]] {
      lockContended();
    }
  }
  bool try_lock() {
    std::uint32_t expected = kFree;
    return word_.compare_exchange_strong(expected, kHeld, std::memory_order_acquire,
                                         std::memory_order_relaxed);
  }
  // Sequentially consistent, as is the sleeper's registering itself before it
  // sleeps: notify_one wakes nobody when it sees no sleeper registered.
  void unlock() {
    if (word_.exchange(kFree) == kHeldWithSleepers) [[unlikely]] {
      word_.notify_one();
    }
  }

 private:
  static constexpr std::uint32_t kFree = 0;
  static constexpr std::uint32_t kHeld = 1;
  // Held, and a locker may sleep on the word: its release wakes one.
  static constexpr std::uint32_t kHeldWithSleepers = 2;

  [[gnu::noinline]] void lockContended() {
    if (spinFor([this] { return word_.load(std::memory_order_relaxed) == kFree && try_lock(); })) {
      return;
    }
    while (word_.exchange(kHeldWithSleepers, std::memory_order_acquire) != kFree) {
      word_.wait(kHeldWithSleepers);
    }
  }

  std::atomic<std::uint32_t> word_{kFree};
};

// A condition variable that counts its sleepers (under gKSTLocks.mutex), so
// that signalling nobody costs nothing.
struct KSTLockCondition {
  std::condition_variable_any variable;
  std::uint32_t sleepers = 0;

  void notify_one() {
    if (sleepers != 0) variable.notify_one();
  }
  void notify_all() {
    if (sleepers != 0) variable.notify_all();
  }
};

// One identifier that is locked or waited for. Made when the first locker
// arrives; when the last one releases it, it stays in the table, idle, for the
// identifier's next locker (up to a bound), so that the lock and unlock of an
// identifier nobody else holds allocate and copy nothing.
//
// The record's lock state is its reader/writer lock: it is changed only with
// gKSTLocks.mutex held, so a locker that finds the identifier free takes it in
// the same pass that finds the record, and one that cannot sleeps on `waiters`.
// Readers are let in whenever no writer holds the identifier, also while a
// writer waits.
struct KSTIdentifierLock {
  // 0 free, -1 held by a writer, n > 0 held by n readers. Written only with
  // gKSTLocks.mutex held; read without it only by waiters spinning until it
  // may let them in.
  std::atomic<std::int32_t> lockState{0};
  // Holders and waiters of this record; guarded by gKSTLocks.mutex.
  std::uint64_t useCount = 0;
  // The thread holding the identifier for writing (guarded by gKSTLocks.mutex):
  // a thread that locks it again would wait for itself forever, so it aborts.
  std::thread::id writer;
  // Lockers waiting for lockState to let them in.
  KSTLockCondition waiters;
  // The table's part, guarded by gKSTLocks.mutex: the key, its hash and the
  // next record of the same bucket.
  std::string identifier;
  std::size_t hash = 0;
  std::unique_ptr<KSTIdentifierLock> next;
};

// Identifier -> record: a chained hash table of live records (use count above
// 0) and of idle ones kept for reuse. Guarded by gKSTLocks.mutex.
class KSTIdentifierLockTable {
 public:
  // Eight bytes at a time, each word multiplied on its own and the products
  // summed, so the multiplications overlap: a UUID's text costs a few
  // nanoseconds (the library's byte-wise hash cost more than the rest of a lock
  // and unlock together).
  static std::size_t hashOf(std::string_view identifier) {
    constexpr std::uint64_t kOdd = 0x9E3779B97F4A7C15ull;
    constexpr std::uint64_t kEven = 0xBF58476D1CE4E5B9ull;
    const char* bytes = identifier.data();
    std::size_t left = identifier.size();
    std::uint64_t odd = identifier.size();
    std::uint64_t even = 0;
    for (; left >= 16; bytes += 16, left -= 16) {
      std::uint64_t first;
      std::uint64_t second;
      std::memcpy(&first, bytes, 8);
      std::memcpy(&second, bytes + 8, 8);
      odd = std::rotl(odd, 23) + first * kOdd;
      even = std::rotl(even, 29) + second * kEven;
    }
    if (left >= 8) {
      std::uint64_t word;
      std::memcpy(&word, bytes, 8);
      odd += word * kEven;
      bytes += 8;
      left -= 8;
    }
    if (left > 0) {
      // The last eight bytes of the text when it has that many (overlapping
      // bytes already taken), else the bytes gathered in a register: a short
      // copy through memory would stall the load that follows it.
      std::uint64_t word = 0;
      if (identifier.size() >= 8) {
        std::memcpy(&word, identifier.data() + identifier.size() - 8, 8);
      } else {
        for (std::size_t i = 0; i < left; ++i) {
          word |= static_cast<std::uint64_t>(static_cast<unsigned char>(bytes[i])) << (8 * i);
        }
      }
      even += word * kOdd;
    }
    std::uint64_t hash = (odd ^ std::rotl(even, 32)) * kOdd;
    return static_cast<std::size_t>(hash ^ (hash >> 32));
  }

  KSTIdentifierLock* find(std::string_view identifier, std::size_t hash) const {
    if (buckets_.empty()) return nullptr;
    for (KSTIdentifierLock* record = buckets_[hash & (buckets_.size() - 1)].get();
         record != nullptr; record = record->next.get()) {
      if (record->hash == hash && record->identifier == identifier) return record;
    }
    return nullptr;
  }

  // The identifier's record, live from now on: found, or made.
  KSTIdentifierLock& acquire(std::string_view identifier, std::size_t hash) {
    if (KSTIdentifierLock* found = find(identifier, hash)) {
      if (found->useCount == 0) --idle_;
      return *found;
    }
    if (records_ + 1 > buckets_.size()) grow();
    auto record = std::make_unique<KSTIdentifierLock>();
    record->identifier.assign(identifier);
    record->hash = hash;
    auto& head = buckets_[hash & (buckets_.size() - 1)];
    record->next = std::move(head);
    head = std::move(record);
    ++records_;
    return *head;
  }

  // The record's last user left (it is free and unused): it stays idle, or
  // goes when enough others are idle already.
  void release(const KSTIdentifierLock& record) {
    if (idle_ < kMaxIdle) {
      ++idle_;
      return;
    }
    std::unique_ptr<KSTIdentifierLock>* link = &buckets_[record.hash & (buckets_.size() - 1)];
    while (link->get() != &record) link = &(*link)->next;
    std::unique_ptr<KSTIdentifierLock> removed = std::move(*link);
    *link = std::move(removed->next);
    --records_;
  }

  // Identifiers locked or waited for.
  std::size_t liveCount() const { return records_ - idle_; }

 private:
  // Enough for every request thread to come back to a few identifiers.
  static constexpr std::size_t kMaxIdle = 256;
  static constexpr std::size_t kInitialBuckets = 64;

  void grow() {
    std::vector<std::unique_ptr<KSTIdentifierLock>> old = std::move(buckets_);
    buckets_.clear();
    buckets_.resize(old.empty() ? kInitialBuckets : old.size() * 2);
    for (auto& head : old) {
      while (head) {
        std::unique_ptr<KSTIdentifierLock> record = std::move(head);
        head = std::move(record->next);
        auto& slot = buckets_[record->hash & (buckets_.size() - 1)];
        record->next = std::move(slot);
        slot = std::move(record);
      }
    }
  }

  std::vector<std::unique_ptr<KSTIdentifierLock>> buckets_;  // a power of two long
  std::size_t records_ = 0;
  std::size_t idle_ = 0;
};

// The process-wide lock state. `mutex` guards every other field and the table.
// It is always taken alone, and never held while waiting: waiters sleep on a
// condition, which releases it.
struct KSTLocksState {
  KSTStateMutex mutex;
  KSTLockCondition allWritersCondition;
  KSTLockCondition allReadersCondition;
  KSTLockCondition identifierWritersCondition;
  KSTLockCondition identifierReadersCondition;
  KSTIdentifierLockTable identifierToLockMap;
  // Identifier locks held or being acquired. Raised before the record's lock is
  // taken, so that a writer of all identifiers also waits for lockers still
  // blocked on a record.
  std::uint32_t identifierReaderCount = 0;
  std::uint32_t identifierWriterCount = 0;
  // The lock on all identifiers: 0 free, -1 held by one writer, n > 0 held by n readers.
  std::int32_t allReaderWriterState = 0;
};

KSTLocksState gKSTLocks;

// Called with `lock` released, returns with it held and `ready()` true: tries
// for a while, then sleeps on the condition. `mayBeReady`, called without the
// mutex, spares the mutex the tries that cannot succeed.
template <typename Ready, typename MayBeReady>
void lockWhen(std::unique_lock<KSTStateMutex>& lock, KSTLockCondition& condition, Ready ready,
              MayBeReady mayBeReady) {
  spinFor([&] {
    if (!mayBeReady() || !lock.try_lock()) return false;
    if (ready()) return true;
    lock.unlock();
    return false;
  });
  if (!lock.owns_lock()) lock.lock();
  ++condition.sleepers;
  condition.variable.wait(lock, ready);
  --condition.sleepers;
}

// Returns with `lock` still held and `ready()` true.
template <typename Ready>
void waitUntil(std::unique_lock<KSTStateMutex>& lock, KSTLockCondition& condition, Ready ready) {
  if (ready()) return;
  lock.unlock();
  lockWhen(lock, condition, ready, [] { return true; });
}

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

// Takes the record's lock once its state lets the locker in (under gKSTLocks.mutex).
void enter(KSTIdentifierLock& record, bool forWriting) {
  if (forWriting) {
    record.lockState.store(-1, std::memory_order_relaxed);
    record.writer = std::this_thread::get_id();
    return;
  }
  const std::int32_t readers = record.lockState.load(std::memory_order_relaxed);
  KST_INVARIANT(readers < INT32_MAX);
  record.lockState.store(readers + 1, std::memory_order_relaxed);
}

void take_one_lock(const std::string& identifier, bool forWriting) {
  const std::size_t hash = KSTIdentifierLockTable::hashOf(identifier);
  std::unique_lock lock(gKSTLocks.mutex);
  if (forWriting) {
    waitUntil(lock, gKSTLocks.identifierWritersCondition,
              [] { return gKSTLocks.allReaderWriterState == 0; });
    ++gKSTLocks.identifierWriterCount;
  } else {
    waitUntil(lock, gKSTLocks.identifierReadersCondition,
              [] { return gKSTLocks.allReaderWriterState != -1; });
    ++gKSTLocks.identifierReaderCount;
  }
  KSTIdentifierLock& record = gKSTLocks.identifierToLockMap.acquire(identifier, hash);
  ++record.useCount;
  // The counts above stay raised while this locker waits for the record, so
  // the lock on all identifiers cannot be taken in between.
  const auto mayEnter = [&record, forWriting] {
    const std::int32_t state = record.lockState.load(std::memory_order_relaxed);
    return forWriting ? state == 0 : state != -1;
  };
  const bool entered = mayEnter();
  if (entered) {
    enter(record, forWriting);
  } else {
    KST_INVARIANT(record.writer != std::this_thread::get_id());
  }
  lock.unlock();

  KSTLog(kLogDebug, "Waiting to lock %@ for %s", identifier, modeName(forWriting));
  if (!entered) {
    lockWhen(lock, record.waiters, mayEnter, mayEnter);
    enter(record, forWriting);
    lock.unlock();
  }
  KSTLog(kLogDebug, "Got lock on identifier %@", identifier);
}

void unlock_one_lock(const std::string& identifier) {
  const std::size_t hash = KSTIdentifierLockTable::hashOf(identifier);
  std::unique_lock lock(gKSTLocks.mutex);
  KSTIdentifierLockTable& map = gKSTLocks.identifierToLockMap;
  KSTIdentifierLock* found = map.find(identifier, hash);
  // An idle record is one nobody holds.
  KST_INVARIANT(found != nullptr && found->useCount > 0);
  KSTIdentifierLock& record = *found;
  KST_INVARIANT(record.lockState.load() != 0);

  if (record.lockState.load() == -1) {
    record.lockState.store(0, std::memory_order_relaxed);
    record.writer = std::thread::id();
    record.waiters.notify_all();
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
    const std::int32_t readersLeft = record.lockState.load() - 1;
    KST_INVARIANT(readersLeft >= 0);
    record.lockState.store(readersLeft, std::memory_order_relaxed);
    if (readersLeft == 0) record.waiters.notify_all();
    KST_INVARIANT(gKSTLocks.allReaderWriterState >= 0);
    KST_INVARIANT(gKSTLocks.identifierReaderCount > 0);
    const std::uint32_t identifierReaders = --gKSTLocks.identifierReaderCount;
    if (gKSTLocks.allReaderWriterState == 0 && identifierReaders == 0 &&
        gKSTLocks.identifierWriterCount == 0) {
      gKSTLocks.allWritersCondition.notify_one();
    }
  }

  KST_INVARIANT(record.useCount > 0);
  --record.useCount;
  KSTLog(kLogDebug, "Unlocked identifier %@", identifier);

  if (record.useCount == 0) {
    KSTLog(kLogDebug, "Destroying lock for identifier %@", identifier);
    KST_INVARIANT(record.lockState.load() == 0);
    map.release(record);
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
    waitUntil(lock, gKSTLocks.allWritersCondition, [] {
      return gKSTLocks.identifierReaderCount == 0 && gKSTLocks.identifierWriterCount == 0 &&
             gKSTLocks.allReaderWriterState == 0;
    });
    gKSTLocks.allReaderWriterState = -1;
  } else {
    waitUntil(lock, gKSTLocks.allReadersCondition, [] {
      return gKSTLocks.identifierWriterCount == 0 && gKSTLocks.allReaderWriterState != -1;
    });
    ++gKSTLocks.allReaderWriterState;
  }
  KSTLog(kLogDebug, "Locked all identifiers for %s", modeName(forWriting));
}

void unlock_all_identifiers() {
  {
    std::unique_lock lock(gKSTLocks.mutex);
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
  return gKSTLocks.identifierToLockMap.liveCount();
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
