#include "platform/dispatch.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/ioprio.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/unique_fd.h"

namespace kestrel::platform {
namespace {

using namespace std::chrono_literals;

// A count that threads can wait on. The timeout only guards against a hang.
class Counter {
 public:
  void add() {
    std::lock_guard lock(mutex_);
    ++value_;
    changed_.notify_all();
  }
  bool waitFor(int target) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, 5s, [&] { return value_ >= target; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  int value_ = 0;
};

// Notices two items running at once.
struct Overlap {
  std::atomic<int> active{0};
  std::atomic<bool> seen{false};
  void enter() {
    if (++active > 1) seen = true;
  }
  void leave() { --active; }
};

std::string threadName() {
  char name[16] = {};
  pthread_getname_np(pthread_self(), name, sizeof name);
  return name;
}

// Runs `work` on the queue and waits until it ran.
void runOn(const std::shared_ptr<DispatchQueue>& queue, const Work& work) {
  Counter done;
  queue->async([&] {
    work();
    done.add();
  });
  ASSERT_TRUE(done.waitFor(1));
}

TEST(DispatchConcurrencyTest, SerialQueueKeepsEachSubmittersOrderAndRunsOneItemAtATime) {
  auto queue = DispatchQueue::createSerial("test.serial");
  constexpr int kThreads = 4;
  constexpr int kItems = 400;
  std::vector<std::pair<int, int>> seen;  // no lock: only the queue keeps items apart
  Overlap overlap;
  Counter done;
  std::vector<std::thread> submitters;
  for (int t = 0; t < kThreads; ++t) {
    submitters.emplace_back([&, t] {
      for (int i = 0; i < kItems; ++i) {
        queue->async([&, t, i] {
          overlap.enter();
          seen.emplace_back(t, i);
          overlap.leave();
          done.add();
        });
      }
    });
  }
  for (auto& thread : submitters) thread.join();
  ASSERT_TRUE(done.waitFor(kThreads * kItems));
  EXPECT_FALSE(overlap.seen);
  std::vector<int> next(kThreads, 0);
  queue->sync([&] {
    for (auto [thread, item] : seen) EXPECT_EQ(item, next[thread]++);
  });
}

TEST(DispatchConcurrencyTest, QueuesSharingASerialTargetNeverOverlap) {
  auto target = DispatchQueue::createSerial("test.target");
  Overlap overlap;
  Counter done;
  int unguarded = 0;
  std::vector<std::thread> submitters;
  for (int q = 0; q < 4; ++q) {
    auto queue = q < 3 ? DispatchQueue::createSerial("test.child")
                       : DispatchQueue::createConcurrent("test.concurrent");
    queue->setTarget(target);
    submitters.emplace_back([&, queue] {
      for (int i = 0; i < 200; ++i) {
        queue->async([&] {
          overlap.enter();
          ++unguarded;
          overlap.leave();
          done.add();
        });
        if (i % 50 == 0) queue->sync([&] { ++unguarded; });
      }
    });
  }
  for (auto& thread : submitters) thread.join();
  ASSERT_TRUE(done.waitFor(800));
  EXPECT_FALSE(overlap.seen);
  target->sync([&] { EXPECT_EQ(unguarded, 800 + 16); });
}

// A serial target makes "would have run by now" exact: a child's drain is
// queued on the target before the target's own check.
TEST(DispatchConcurrencyTest, SuspendHoldsItemsUntilResumed) {
  auto target = DispatchQueue::createSerial("test.target");
  auto child = DispatchQueue::createSerial("test.child");
  child->setTarget(target);
  std::atomic<int> ran{0};
  child->suspend();
  child->async([&] { ++ran; });
  target->sync([&] { EXPECT_EQ(ran, 0); });
  child->resume();
  target->sync([&] { EXPECT_EQ(ran, 1); });

  // Suspending the target holds the child's items too.
  target->suspend();
  child->async([&] { ++ran; });
  std::thread resumer([&] {
    EXPECT_EQ(ran, 1);
    target->resume();
  });
  child->sync([&] { EXPECT_EQ(ran, 2); });
  resumer.join();

  // Counted; and the item that suspends its own queue still finishes.
  target->suspend();  // both items are queued before either runs
  child->async([&] {
    child->suspend();
    child->suspend();
    ++ran;
  });
  child->async([&] { ++ran; });
  target->resume();
  target->sync([&] { EXPECT_EQ(ran, 3); });
  child->resume();
  target->sync([&] { EXPECT_EQ(ran, 3); });
  child->resume();
  child->sync([&] { EXPECT_EQ(ran, 4); });

  // A concurrent queue's suspend holds items already handed to its target.
  auto concurrent = DispatchQueue::createConcurrent("test.concurrent");
  concurrent->setTarget(target);
  target->suspend();
  concurrent->async([&] { ++ran; });
  concurrent->async([&] { ++ran; });
  concurrent->suspend();
  target->resume();
  target->sync([&] { EXPECT_EQ(ran, 4); });
  concurrent->resume();
  target->sync([&] { EXPECT_EQ(ran, 6); });
}

TEST(DispatchConcurrencyTest, SyncFromAnotherQueueRunsInPlaceAfterEarlierItems) {
  auto queue = DispatchQueue::createSerial("test.sync");
  auto target = DispatchQueue::createSerial("test.target");
  auto other = DispatchQueue::createSerial("test.other");
  queue->setTarget(target);
  std::vector<int> order;
  queue->suspend();
  queue->async([&] { order.push_back(1); });
  std::thread resumer([&] { queue->resume(); });
  runOn(other, [&] {
    auto caller = std::this_thread::get_id();
    queue->sync([&] {
      EXPECT_EQ(std::this_thread::get_id(), caller);
      EXPECT_TRUE(queue->isCurrent());
      EXPECT_TRUE(target->isCurrent());
      EXPECT_TRUE(other->isCurrent());
      order.push_back(2);
    });
  });
  resumer.join();
  runOn(queue, [&] {
    EXPECT_TRUE(target->isCurrent());
    EXPECT_TRUE(DispatchQueue::global()->isCurrent());
    EXPECT_FALSE(other->isCurrent());
    EXPECT_EQ(order, (std::vector<int>{1, 2}));
  });
  EXPECT_FALSE(queue->isCurrent());
}

TEST(DispatchConcurrencyTest, SyncOnAQueueFromAnItemOfItsTargetRunsTheBacklogFirst) {
  auto target = DispatchQueue::createSerial("test.target");
  auto child = DispatchQueue::createSerial("test.child");
  child->setTarget(target);
  std::vector<int> order;
  runOn(target, [&] {
    // The child's drain waits behind this very item: sync must not wait for it.
    child->async([&] { order.push_back(1); });
    child->async([&] { order.push_back(2); });
    child->sync([&] { order.push_back(3); });
    child->async([&] { order.push_back(4); });
  });
  child->sync([&] { EXPECT_EQ(order, (std::vector<int>{1, 2, 3, 4})); });
}

TEST(DispatchConcurrencyTest, SyncOnAChildAndOnItsTargetFromManyThreadsDoesNotDeadlock) {
  auto target = DispatchQueue::createSerial("test.target");
  auto child = DispatchQueue::createSerial("test.child");
  child->setTarget(target);
  int unguarded = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 200; ++i) {
        if (t % 2 == 0) {
          child->async([&] { ++unguarded; });
          child->sync([&] { ++unguarded; });
        } else {
          target->sync([&] { child->sync([&] { ++unguarded; }); });
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  child->sync([&] { EXPECT_EQ(unguarded, 2 * 200 * 2 + 2 * 200); });
}

TEST(DispatchConcurrencyTest, ConcurrentQueueRunsItemsInParallel) {
  auto queue = DispatchQueue::createConcurrent("test.concurrent");
  Counter arrived;
  Counter done;
  std::atomic<int> metTheOther{0};
  for (int i = 0; i < 2; ++i) {
    queue->async([&] {
      arrived.add();
      if (arrived.waitFor(2)) ++metTheOther;  // only if both run at once
      done.add();
    });
  }
  ASSERT_TRUE(done.waitFor(2));
  EXPECT_EQ(metTheOther, 2);
  auto caller = std::this_thread::get_id();
  queue->sync([&] { EXPECT_EQ(std::this_thread::get_id(), caller); });
}

// Names are cut to what the kernel holds; background work runs at the lowest priorities.
TEST(DispatchTest, PoolThreadsCarryTheirNamesAndPriorities) {
  auto queue = DispatchQueue::createSerial("com.example.a-rather-long-label");
  auto background = DispatchQueue::createSerial("test.background");
  background->setTarget(DispatchQueue::global(QueuePriority::Background));
  runOn(queue, [] { EXPECT_EQ(threadName(), "com.example.a-r"); });
  runOn(background, [] {
    auto tid = static_cast<id_t>(syscall(SYS_gettid));
    EXPECT_EQ(getpriority(PRIO_PROCESS, tid), 19);
    EXPECT_EQ(IOPRIO_PRIO_CLASS(syscall(SYS_ioprio_get, IOPRIO_WHO_PROCESS, tid)),
              IOPRIO_CLASS_IDLE);
  });
}

TEST(DispatchTest, MainQueueRunsOnTheLoopThreadAndKeepsItemsBetweenRuns) {
  auto main = DispatchQueue::main();
  auto loopThread = std::this_thread::get_id();
  std::vector<int> ran;
  // Submitted while no loop runs: kept until one does.
  main->async([&] {
    EXPECT_EQ(std::this_thread::get_id(), loopThread);
    EXPECT_TRUE(main->isCurrent());
    ran.push_back(1);
    stopMainLoop(3);
  });
  main->async([&] {
    ran.push_back(2);
    stopMainLoop(4);
  });
  EXPECT_EQ(runMainLoop(), 3);
  ASSERT_EQ(ran, std::vector<int>{1});  // the loop stops right after the item that asked
  EXPECT_EQ(runMainLoop(), 4);
  EXPECT_EQ(ran, (std::vector<int>{1, 2}));

  // A queue targeted at the main queue runs there too; a worker can sync with the loop.
  auto child = DispatchQueue::createSerial("test.on-main");
  child->setTarget(main);
  child->async([&] {
    EXPECT_EQ(std::this_thread::get_id(), loopThread);
    DispatchQueue::global()->async([&] {
      main->sync([&] { ran.push_back(3); });
      stopMainLoop(5);
    });
  });
  EXPECT_EQ(runMainLoop(), 5);
  EXPECT_EQ(ran, (std::vector<int>{1, 2, 3}));

  // Termination signals reach their handler on the main queue.
  auto watch = watchTerminationSignals([&](int signal) {
    EXPECT_EQ(std::this_thread::get_id(), loopThread);
    stopMainLoop(signal);
  });
  ASSERT_NE(watch, nullptr);
  ASSERT_EQ(kill(getpid(), SIGTERM), 0);
  EXPECT_EQ(runMainLoop(), SIGTERM);
  ASSERT_EQ(kill(getpid(), SIGINT), 0);
  EXPECT_EQ(runMainLoop(), SIGINT);
}

TEST(DispatchDeathTest, MisuseAbortsWithAMessage) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(DispatchQueue::createSerial("test.unbalanced")->resume(),
               "resume\\(\\) on queue 'test.unbalanced' without a matching suspend");
  EXPECT_DEATH(
      {
        auto queue = DispatchQueue::createSerial("test.self");
        queue->sync([&] { queue->sync([] {}); });
      },
      "sync\\(\\) on queue 'test.self' from one of its own items would deadlock");
  EXPECT_DEATH(
      DispatchQueue::createSerial("test.throws")->sync([] { throw std::runtime_error("boom"); }),
      "queue 'test.throws' threw .*boom");
}

struct Pipe {
  Pipe() {
    int fds[2];
    EXPECT_EQ(pipe2(fds, O_CLOEXEC | O_NONBLOCK), 0);
    readEnd.reset(fds[0]);
    writeEnd.reset(fds[1]);
  }
  void write(const std::string& bytes) {
    ASSERT_EQ(::write(writeEnd.get(), bytes.data(), bytes.size()),
              static_cast<ssize_t>(bytes.size()));
  }
  UniqueFd readEnd;
  UniqueFd writeEnd;
};

TEST(DispatchSourceConcurrencyTest, HandlerRunsOnceAtATimeUntilTheDataIsConsumed) {
  Pipe pipe;
  // A concurrent queue would happily run two handlers at once.
  auto queue = DispatchQueue::createConcurrent("test.source");
  Overlap overlap;
  Counter reads;
  auto source = ReadSource::create(pipe.readEnd.get(), queue, [&] {
    overlap.enter();
    char byte;
    bool got = read(pipe.readEnd.get(), &byte, 1) == 1;  // the rest keeps it readable
    std::this_thread::yield();
    overlap.leave();
    if (got) reads.add();
  });
  ASSERT_NE(source, nullptr);
  source->resume();
  pipe.write("abcdefghij");
  ASSERT_TRUE(reads.waitFor(10));
  pipe.write("k");
  ASSERT_TRUE(reads.waitFor(11));
  EXPECT_FALSE(overlap.seen);
}

TEST(DispatchSourceConcurrencyTest, SourceCanBeDestroyedFromItsOwnHandler) {
  Pipe pipe;
  auto queue = DispatchQueue::createSerial("test.source");
  std::atomic<int> fired{0};
  Counter firstRun;
  std::unique_ptr<ReadSource> source;
  source = ReadSource::create(pipe.readEnd.get(), queue, [&] {
    source.reset();
    ++fired;
    firstRun.add();
  });
  source->resume();
  pipe.write("x");
  ASSERT_TRUE(firstRun.waitFor(1));
  queue->sync([&] { EXPECT_EQ(source, nullptr); });

  // The unread byte now reaches a new source only.
  Counter drained;
  auto again = ReadSource::create(pipe.readEnd.get(), queue, [&] {
    char buffer[16];
    while (read(pipe.readEnd.get(), buffer, sizeof buffer) > 0) {
    }
    drained.add();
  });
  again->resume();
  ASSERT_TRUE(drained.waitFor(1));
  queue->sync([&] { EXPECT_EQ(fired, 1); });
}

TEST(DispatchSourceConcurrencyTest, DestroyingWaitsForARunningHandler) {
  Pipe pipe;
  auto queue = DispatchQueue::createSerial("test.source");
  Counter entered;
  Counter release;
  std::atomic<bool> destroyed{false};
  std::atomic<bool> destroyedTooEarly{false};
  auto source = ReadSource::create(pipe.readEnd.get(), queue, [&] {
    entered.add();
    EXPECT_TRUE(release.waitFor(1));
    if (destroyed) destroyedTooEarly = true;
  });
  source->resume();
  pipe.write("x");
  ASSERT_TRUE(entered.waitFor(1));
  std::thread destroyer([&] {
    source.reset();
    destroyed = true;
  });
  // Lets the destroyer reach its wait; the check does not depend on it.
  std::this_thread::sleep_for(20ms);
  release.add();
  destroyer.join();
  EXPECT_FALSE(destroyedTooEarly);
}

}  // namespace
}  // namespace kestrel::platform
