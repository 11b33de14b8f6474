#include "daemon/locks.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "daemon/log.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using namespace std::chrono_literals;

// Long enough for a thread that could get a lock to have got it; a thread that
// is rightly blocked stays blocked however long we wait.
constexpr auto kSettle = 100ms;
constexpr auto kPatience = 10s;

// Which lock a holder takes: that of one identifier, or of all of them.
constexpr std::nullopt_t kAll = std::nullopt;

// Takes a lock on a thread of its own (through a guard) and holds it until
// release(). A holder that is still waiting when it is released is a failure,
// not a hang: its thread is left behind, blocked, with the state it shares.
class LockHolder {
 public:
  LockHolder(std::optional<std::string> identifier, bool forWriting)
      : state_(std::make_shared<State>()) {
    thread_ = std::thread([state = state_, identifier, forWriting] {
      const auto hold = [&state] {
        state->acquired.set_value();
        state->releaseFuture.wait();
      };
      if (identifier) {
        KSTIdentifierLockGuard guard(*identifier, forWriting);
        hold();
      } else {
        KSTAllIdentifiersLockGuard guard(forWriting);
        hold();
      }
    });
  }
  ~LockHolder() { release(); }
  LockHolder(const LockHolder&) = delete;
  LockHolder& operator=(const LockHolder&) = delete;

  bool acquired() const { return state_->acquiredFuture.wait_for(0s) == std::future_status::ready; }
  bool waitAcquired() const {
    return state_->acquiredFuture.wait_for(kPatience) == std::future_status::ready;
  }
  void release() {
    if (!thread_.joinable()) return;
    state_->release.set_value();
    if (waitAcquired()) {
      thread_.join();
    } else {
      ADD_FAILURE() << "a lock holder was still waiting for its lock when released";
      thread_.detach();
    }
  }

 private:
  struct State {
    std::promise<void> acquired;
    std::shared_future<void> acquiredFuture = acquired.get_future().share();
    std::promise<void> release;
    std::shared_future<void> releaseFuture = release.get_future().share();
  };

  std::shared_ptr<State> state_;
  std::thread thread_;
};

class LocksConcurrencyTest : public ::testing::Test {
 protected:
  // Waits until a locker has announced that it waits (its counts are raised by then).
  bool waitForLine(std::string_view tag, std::string_view message, std::size_t count = 1) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (fakes.countLogged(message, testing::Match::Exact, tag) < count) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(1ms);
    }
    return true;
  }

  std::vector<std::string> messagesTagged(std::string_view tag) const {
    std::vector<std::string> messages;
    for (const auto& line : fakes.logging->lines()) {
      if (line.tag == tag) messages.push_back(line.message);
    }
    return messages;
  }

  testing::FakeServices fakes;
};

TEST_F(LocksConcurrencyTest, WriterWaitsForBothReadersAndTheRecordGoesWithTheLastRelease) {
  LockHolder reader1("X", kKSTLockForReading);
  LockHolder reader2("X", kKSTLockForReading);
  ASSERT_TRUE(reader1.waitAcquired());
  ASSERT_TRUE(reader2.waitAcquired());

  LockHolder writer("X", kKSTLockForWriting);
  ASSERT_TRUE(waitForLine("take_one_lock", "Waiting to lock X for writing"));
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(writer.acquired());
  EXPECT_EQ(KSTLocksLiveRecordCount(), 1u);

  reader1.release();
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(writer.acquired());

  reader2.release();
  ASSERT_TRUE(writer.waitAcquired());
  EXPECT_EQ(fakes.countLogged("Destroying lock for identifier X", testing::Match::Exact,
                              "unlock_one_lock"),
            0u);

  writer.release();
  EXPECT_EQ(KSTLocksLiveRecordCount(), 0u);
  EXPECT_EQ(fakes.countLogged("Unlocked identifier X", testing::Match::Exact, "unlock_one_lock"),
            3u);
  EXPECT_EQ(fakes.countLogged("Destroying lock for identifier X", testing::Match::Exact,
                              "unlock_one_lock"),
            1u);
}

TEST_F(LocksConcurrencyTest, WaitingAllWriterDoesNotHoldBackNewReadersButAHeldOneDoes) {
  LockHolder reader("X", kKSTLockForReading);
  ASSERT_TRUE(reader.waitAcquired());

  LockHolder allWriter(kAll, kKSTLockForWriting);
  ASSERT_TRUE(waitForLine("_lock_all_identifiers", "Waiting to lock all identifiers for writing"));
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(allWriter.acquired());

  // Readers arriving while the writer of all identifiers only waits get in.
  {
    LockHolder sameIdentifier("X", kKSTLockForReading);
    LockHolder otherIdentifier("Y", kKSTLockForReading);
    EXPECT_TRUE(sameIdentifier.waitAcquired());
    EXPECT_TRUE(otherIdentifier.waitAcquired());
  }
  EXPECT_FALSE(allWriter.acquired());

  reader.release();
  ASSERT_TRUE(allWriter.waitAcquired());

  // Once it holds the lock, identifier readers and writers and readers of all
  // identifiers wait for it.
  LockHolder lateReader("Z", kKSTLockForReading);
  LockHolder lateWriter("W", kKSTLockForWriting);
  LockHolder lateAllReader(kAll, kKSTLockForReading);
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(lateReader.acquired());
  EXPECT_FALSE(lateWriter.acquired());
  EXPECT_FALSE(lateAllReader.acquired());

  allWriter.release();
  EXPECT_TRUE(lateReader.waitAcquired());
  // The identifier writer and the reader of all identifiers exclude each other:
  // one gets in, then the other.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!lateWriter.acquired() && !lateAllReader.acquired() &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(1ms);
  }
  const bool writerFirst = lateWriter.acquired();
  LockHolder& firstIn = writerFirst ? lateWriter : lateAllReader;
  LockHolder& secondIn = writerFirst ? lateAllReader : lateWriter;
  ASSERT_TRUE(firstIn.acquired());
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(secondIn.acquired());
  firstIn.release();
  EXPECT_TRUE(secondIn.waitAcquired());
}

TEST_F(LocksConcurrencyTest, AllReadersShareWithIdentifierReadersButExcludeIdentifierWriters) {
  LockHolder allReader1(kAll, kKSTLockForReading);
  LockHolder allReader2(kAll, kKSTLockForReading);
  ASSERT_TRUE(allReader1.waitAcquired());
  ASSERT_TRUE(allReader2.waitAcquired());

  LockHolder identifierReader("X", kKSTLockForReading);
  EXPECT_TRUE(identifierReader.waitAcquired());

  LockHolder identifierWriter("Y", kKSTLockForWriting);
  LockHolder allWriter(kAll, kKSTLockForWriting);
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(identifierWriter.acquired());
  EXPECT_FALSE(allWriter.acquired());

  allReader1.release();
  std::this_thread::sleep_for(kSettle);
  EXPECT_FALSE(identifierWriter.acquired());

  allReader2.release();
  EXPECT_TRUE(identifierWriter.waitAcquired());
  EXPECT_FALSE(allWriter.acquired());

  identifierReader.release();
  identifierWriter.release();
  EXPECT_TRUE(allWriter.waitAcquired());
}

TEST_F(LocksConcurrencyTest, ArraysAreTakenAscendingAndReleasedDescendingEachIdentifierOnce) {
  struct Row {
    std::vector<std::string> identifiers;
    std::vector<std::string> lockOrder;
  } rows[] = {
      {{"b", "a"}, {"a", "b"}}, {{"a", "b"}, {"a", "b"}}, {{"b", "a", "b", "a"}, {"a", "b"}},
      {{"c", "c"}, {"c"}},      {{"a", "B"}, {"B", "a"}},  // by character value: upper case first
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::PrintToString(row.identifiers));
    fakes.logging->clear();
    KSTIdentifierLockGuard guard(row.identifiers, kKSTLockForReading);
    EXPECT_EQ(KSTLocksLiveRecordCount(), row.lockOrder.size());

    std::vector<std::string> expectedTaking;
    for (const auto& identifier : row.lockOrder) {
      expectedTaking.push_back("Waiting to lock " + identifier + " for reading");
      expectedTaking.push_back("Got lock on identifier " + identifier);
    }
    EXPECT_EQ(messagesTagged("take_one_lock"), expectedTaking);

    guard.unlock();
    std::vector<std::string> expectedReleasing;
    for (auto it = row.lockOrder.rbegin(); it != row.lockOrder.rend(); ++it) {
      expectedReleasing.push_back("Unlocked identifier " + *it);
      expectedReleasing.push_back("Destroying lock for identifier " + *it);
    }
    EXPECT_EQ(messagesTagged("unlock_one_lock"), expectedReleasing);
    EXPECT_EQ(KSTLocksLiveRecordCount(), 0u);
  }
}

// Many threads mixing every kind of lock; each holder checks, on entry and
// again before it leaves, that nobody it excludes holds a lock at the same time.
TEST_F(LocksConcurrencyTest, MixedLockersNeverOverlapWhereTheyExcludeEachOther) {
  // Debug lines off: the check is about exclusion, not the log.
  ASSERT_TRUE(Log::open("com.zorvane.kestreld", fakes.scratch.path() + "/log", kLogNotice));

  constexpr int kThreads = 8;
  constexpr int kIterations = 1500;
  const std::array<std::string, 3> identifiers = {"A", "B", "C"};
  // Holders of each kind: identifier writers and readers per identifier, and of all identifiers.
  std::array<std::atomic<int>, 3> writers{}, readers{};
  std::atomic<int> allWriters{0}, allReaders{0}, violations{0}, allWriterEntries{0};
  auto anyIdentifierHeld = [&](const std::array<std::atomic<int>, 3>& counts) {
    return counts[0] + counts[1] + counts[2] > 0;
  };
  // Checks on entry and again before leaving, with a yield between.
  auto twice = [&](const std::function<bool()>& ok) {
    for (int i = 0; i < 2; ++i, std::this_thread::yield()) violations += ok() ? 0 : 1;
  };
  auto holdIdentifiers = [&](std::vector<std::size_t> picked, bool forWriting) {
    std::vector<std::string> names;
    for (std::size_t k : picked) names.push_back(identifiers[k]);
    KSTIdentifierLockGuard guard(names, forWriting);
    std::sort(picked.begin(), picked.end());
    picked.erase(std::unique(picked.begin(), picked.end()), picked.end());
    for (std::size_t k : picked) ++(forWriting ? writers : readers)[k];
    twice([&] {
      for (std::size_t k : picked) {
        if (writers[k] != (forWriting ? 1 : 0) || allWriters != 0) return false;
        if (forWriting && (readers[k] != 0 || allReaders != 0)) return false;
      }
      return true;
    });
    for (std::size_t k : picked) --(forWriting ? writers : readers)[k];
  };
  auto holdAll = [&](bool forWriting) {
    KSTAllIdentifiersLockGuard guard(forWriting);
    ++(forWriting ? allWriters : allReaders);
    allWriterEntries += forWriting ? 1 : 0;
    twice([&] {
      if (allWriters != (forWriting ? 1 : 0) || anyIdentifierHeld(writers)) return false;
      return !forWriting || (allReaders == 0 && !anyIdentifierHeld(readers));
    });
    --(forWriting ? allWriters : allReaders);
  };

  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      std::mt19937 random(static_cast<unsigned>(t) * 7919u + 1u);
      std::uniform_int_distribution<std::size_t> pickIdentifier(0, 2);
      std::uniform_int_distribution<int> pickOperation(0, 9);
      for (int i = 0; i < kIterations; ++i) {
        const int operation = pickOperation(random);
        const bool forWriting = operation % 2 == 0;
        if (operation < 4) {
          holdIdentifiers({pickIdentifier(random)}, forWriting);
        } else if (operation < 8) {
          holdIdentifiers({pickIdentifier(random), pickIdentifier(random), pickIdentifier(random)},
                          forWriting);
        } else {
          holdAll(forWriting);
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();

  EXPECT_EQ(violations.load(), 0);
  EXPECT_GT(allWriterEntries.load(), 0);
  EXPECT_EQ(KSTLocksLiveRecordCount(), 0u);
  // Everything was released: a writer of all identifiers gets in at once.
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
}

using LocksDeathTest = ::testing::Test;

TEST_F(LocksDeathTest, MisuseAbortsWithTheFailedCondition) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  testing::FakeServices fakes;
  struct Row {
    const char* label;
    std::function<void()> misuse;
    const char* message;
  } rows[] = {
      {"identifier never locked in this process", [] { unlock_identifier("X"); },
       "found != nullptr"},
      {"identifier released twice",
       [] {
         _lock_identifier("X", kKSTLockForWriting);
         unlock_identifier("X");
         unlock_identifier(std::vector<std::string>{"X"});
       },
       "found != nullptr"},
      {"identifier locked again by its writer",
       [] {
         _lock_identifier("X", kKSTLockForWriting);
         _lock_identifier("X", kKSTLockForReading);
       },
       "record.writer != "},
      {"all identifiers not locked", [] { unlock_all_identifiers(); }, "allReaderWriterState > 0"},
      {"number as identifier", [] { _lock_identifier(PlistValue(42), kKSTLockForReading); },
       "Unknown parameter type!"},
      {"array holding a number",
       [] {
         _lock_identifier(PlistValue(PlistArray{"a", 1}), kKSTLockForWriting);
       },
       "Unknown parameter type!"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    EXPECT_DEATH(row.misuse(), row.message);
  }
}

}  // namespace
}  // namespace kestrel
