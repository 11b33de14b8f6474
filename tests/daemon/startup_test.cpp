#include "daemon/startup.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <thread>

#include "daemon/daemon_state.h"
#include "daemon/log.h"
#include "platform/linux/key_bag_linux.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using namespace std::chrono_literals;

class StartupTest : public ::testing::Test {
 protected:
  StartupTest() {
    hooks.startListener = [this](std::shared_ptr<platform::DispatchQueue> queue) {
      listenerQueue = queue;
      transactionsAtListener = fakes.keepAlive->openTransactions();
      return listenerStarts;
    };
  }

  std::vector<std::string> messages() const {
    std::vector<std::string> result;
    for (const auto& line : fakes.logging->lines()) result.push_back(line.message);
    return result;
  }

  bool logged(const std::string& message) const { return fakes.logging->containsMessage(message); }

  // Messages holding these texts appear in this order (others may come between them).
  void expectInOrder(const std::vector<std::string>& expected) const {
    const auto all = messages();
    auto from = all.begin();
    for (const auto& message : expected) {
      auto found = std::find_if(from, all.end(), [&](const std::string& line) {
        return line.find(message) != std::string::npos;
      });
      ASSERT_NE(found, all.end()) << "missing or out of order: " << message;
      from = found + 1;
    }
  }

  // Runs the main queue until every item queued so far on the main queue ran.
  static void drainMainQueue() {
    platform::DispatchQueue::main()->async([] { platform::stopMainLoop(0); });
    platform::runMainLoop();
  }

  testing::FakeServices fakes;
  KSTStartupHooks hooks;
  bool listenerStarts = true;
  std::shared_ptr<platform::DispatchQueue> listenerQueue;
  std::uint64_t transactionsAtListener = 99;
};

constexpr const char* kLogPath = "/private/var/root/Library/Logs/Kestrel/kestreld.log";

// Once per boot is checked end to end; here, the order and what start-up sets up.
TEST_F(StartupTest, FirstStartDoesBootWorkInOrderAndLaterStartsSkipIt) {
  // Something for each housekeeping step that says so in the log: a journal
  // for recovery, an orphan for the boot-time clean-up.
  const std::string replace = fakes.scratch.resolve(
      "/private/var/root/Library/Kestrel/Replace/0A1B2C3D-0000-4000-8000-000000000000.plist");
  fakes.scratch.writeFile(replace.substr(fakes.scratch.path().size()), "not a property list");
  const std::string orphan = fakes.scratch.resolve(
      "/private/var/mobile/Containers/Data/Application/0A1B2C3D-0000-4000-8000-00000000000A");
  std::filesystem::create_directories(orphan);
  // Without a log handle every level is written, so the debug lines show the order.
  fakes.logging->setOpenFails(true);
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  expectInOrder({
      "kestreld performing first boot initialization",
      "Failed to read replace file at URL " + replace,
      "LockState=0",
      "Deleting orphaned data missing a metadata file at: " + orphan,
      "kestreld first boot cleanup complete",
  });
  // The unopenable log is reported to the system log, and start-up goes on.
  EXPECT_EQ(fakes.logging->systemLog(),
            std::vector<std::string>{"Failed to set up rotating logs at path " +
                                     fakes.scratch.resolve(kLogPath)});
  EXPECT_TRUE(fakes.logging->diskLogging().empty());
  EXPECT_EQ(fakes.semaphores->names(), std::set<std::string>{"kestreld.fb_check"});
  EXPECT_TRUE(fakes.upcall->sourceResumed());
  EXPECT_EQ(fakes.keyBag->registrationCount(), 1u);
  ASSERT_NE(listenerQueue, nullptr);
  // Start-up's transaction ended before requests begin; only the death-row
  // sweep that start-up queued may still hold one.
  EXPECT_LE(transactionsAtListener, 1u);
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->openTransactions(), 0u);

  fakes.logging->clear();
  std::filesystem::create_directories(orphan);
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  EXPECT_FALSE(logged("kestreld performing first boot initialization"));
  EXPECT_FALSE(logged("Deleting orphaned data missing a metadata file at: " + orphan));
}

TEST_F(StartupTest, LogGoesToTheLogDirectoryWithTheBuildsRotation) {
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  const std::string logPath = fakes.scratch.resolve(kLogPath);
  EXPECT_EQ(fakes.logging->openedPath(), logPath);
  EXPECT_EQ(Log::currentLevel(), kLogNotice);
  fakes.deviceInfo->setInternalBuild(true);
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  const auto settings = fakes.logging->diskLogging();
  ASSERT_EQ(settings.size(), 2u);
  EXPECT_EQ(std::pair(settings[0].fileCount, settings[0].fileSize),
            (std::pair<std::size_t, std::size_t>(1, 102400)));
  EXPECT_EQ(settings[1].path, logPath);
  EXPECT_EQ(std::pair(settings[1].fileCount, settings[1].fileSize),
            (std::pair<std::size_t, std::size_t>(4, 262144)));
}

TEST_F(StartupTest, UpcallRegistrationFailureExitsBeforeServing) {
  struct Row {
    const char* label;
    bool checkInFails;
    bool sourceFails;
  } rows[] = {{"check-in", true, false}, {"receive source", false, true}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    fakes.logging->clear();
    fakes.upcall->setCheckInFails(row.checkInFails);
    fakes.upcall->setSourceFails(row.sourceFails);
    listenerQueue.reset();
    EXPECT_EQ(KSTDaemonStart(hooks), -1);
    EXPECT_TRUE(logged("Failed to initialize kernel upcall interface. THIS IS BAD! Exiting."));
    EXPECT_EQ(listenerQueue, nullptr);
    EXPECT_TRUE(fakes.semaphores->names().empty());  // boot-time work is not marked done
  }
}

TEST_F(StartupTest, FailuresThatDoNotStopStartUpAreLogged) {
  fakes.semaphores->setCreateStatus(EACCES);
  fakes.keyBag->setRegistrationStatus(5);
  listenerStarts = false;
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  EXPECT_TRUE(
      fakes.logging->contains("set_first_boot_work_completed",
                              "Failed to create semaphore kestreld.fb_check: Permission denied"));
  EXPECT_TRUE(logged("Failed to register for com.zorvane.keybag.lock-status: 5"));
  EXPECT_TRUE(logged("unable to start vexel service!"));

  // The mark was not made, so the next start does the boot-time work again.
  fakes.semaphores->setCreateStatus(0);
  fakes.logging->clear();
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  EXPECT_TRUE(logged("kestreld performing first boot initialization"));
}

TEST_F(StartupTest, LockedDeviceHoldsTheLockStateQueueUntilTheLockStateFileSaysUnlocked) {
  // The real key bag, watching the lock-state file beneath the scratch root.
  fakes.services.keyBag = std::make_shared<platform::LinuxKeyBag>(fakes.scratch.root());
  fakes.install();
  fakes.scratch.writeFile("/run/kestrel/lock-state", "1\n");
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  EXPECT_TRUE(KSTIsLocked());

  std::atomic<bool> ran{false};
  KSTLockStateQueue()->async([&] { ran = true; });
  std::this_thread::sleep_for(100ms);
  EXPECT_FALSE(ran);

  fakes.scratch.writeFile("/run/kestrel/lock-state", "0\n");
  // The notification arrives on the main queue; run it until the queued work ran.
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (!ran && std::chrono::steady_clock::now() < deadline) {
    drainMainQueue();
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_TRUE(ran);
  EXPECT_FALSE(KSTIsLocked());
}

// States other than locked (1) or unlocked (0) change nothing; repeated
// notifications keep the queue's suspends and resumes balanced.
TEST_F(StartupTest, LockNotificationsFollowOnlyLockedAndUnlocked) {
  fakes.keyBag->setLockState(1);
  ASSERT_EQ(KSTDaemonStart(hooks), 0);
  ASSERT_TRUE(KSTIsLocked());
  const struct {
    int state;
    bool locked;
  } steps[] = {{2, true}, {0, false}, {-1, false}, {1, true}, {1, true}, {0, false}, {0, false}};
  for (const auto& step : steps) {
    SCOPED_TRACE(step.state);
    fakes.keyBag->setLockState(step.state);
    fakes.keyBag->notifyLockStatusChanged();
    drainMainQueue();
    EXPECT_EQ(KSTIsLocked(), step.locked);
  }
  std::atomic<bool> ran{false};
  KSTLockStateQueue()->sync([&] { ran = true; });  // would hang if a suspend were left over
  EXPECT_TRUE(ran);
}

}  // namespace
}  // namespace kestrel
