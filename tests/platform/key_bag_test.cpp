#include <gtest/gtest.h>

#include <filesystem>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/key_bag_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using namespace std::chrono_literals;
using testing::ScratchRoot;

constexpr const char* kLockState = "/run/kestrel/lock-state";
constexpr const char* kMultiUser = "/etc/kestrel/multi-user";

// One key bag throughout: each write (and the removal) is seen at once.
TEST(KeyBagTest, LockStateIsParsedFromTheLockStateFile) {
  struct Row {
    const char* content;  // nullptr: no file
    int expected;
  };
  const Row rows[] = {
      {nullptr, KeyBag::kUnlocked},
      {"0\n", KeyBag::kUnlocked},
      {"1", KeyBag::kLocked},
      {"3\n", 3},
      {"", -1},
      {"1x", -1},
      {nullptr, KeyBag::kUnlocked},
  };
  ScratchRoot scratch;
  LinuxKeyBag keyBag(scratch.root());
  for (const Row& row : rows) {
    SCOPED_TRACE(row.content != nullptr ? "\"" + std::string(row.content) + "\"" : "no file");
    if (row.content != nullptr) {
      scratch.writeFile(kLockState, row.content);
    } else {
      std::filesystem::remove(scratch.resolve(kLockState));
    }
    EXPECT_EQ(keyBag.lockState(), row.expected);
  }
}

TEST(KeyBagTest, WritingTheLockStateRunsTheHandlerOnTheGivenQueue) {
  ScratchRoot scratch;
  const auto queue = DispatchQueue::createSerial("key-bag-test");
  // What the handler saw, each time it ran; outlives the key bag, whose handler writes it.
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<int> states;
  bool allOnQueue = true;
  LinuxKeyBag keyBag(scratch.root());
  const auto handler = [&] {
    const int state = keyBag.lockState();
    std::lock_guard lock(mutex);
    allOnQueue &= queue->isCurrent();
    states.push_back(state);
    changed.notify_all();
  };
  ASSERT_EQ(keyBag.registerLockStatusNotification(queue, handler), 0);

  std::size_t from = 0;
  for (const int state : {KeyBag::kLocked, KeyBag::kUnlocked}) {
    SCOPED_TRACE(state);
    scratch.writeFile(kLockState, std::to_string(state));
    std::unique_lock lock(mutex);
    ASSERT_TRUE(changed.wait_for(lock, 10s, [&] {
      return std::find(states.begin() + from, states.end(), state) != states.end();
    }));
    from = states.size();
  }
  queue->sync([] {});
  std::lock_guard lock(mutex);
  EXPECT_TRUE(allOnQueue);
}

TEST(KeyBagTest, RegistrationFailsWithAnErrnoWhenTheStateDirectoryCannotBeMade) {
  ScratchRoot scratch;
  scratch.writeFile("/run", "not a directory");
  LinuxKeyBag keyBag(scratch.root());
  EXPECT_EQ(keyBag.registerLockStatusNotification(DispatchQueue::createSerial("q"), [] {}),
            ENOTDIR);
}

// Without the multi-user file the device is single-user and has no session list.
TEST(KeyBagTest, TheMultiUserFileSetsTheModeAndListsTheSessions) {
  struct Row {
    const char* content;                                 // nullptr: no file
    std::optional<std::vector<std::uint32_t>> expected;  // nullopt: an error
  };
  const Row rows[] = {
      {"501 502\n503\t504\n\n", std::vector<std::uint32_t>{501, 502, 503, 504}},
      {"", std::vector<std::uint32_t>{}},
      {"501 abc", std::nullopt},
      {"4294967296", std::nullopt},
      {nullptr, std::nullopt},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.content != nullptr ? "\"" + std::string(row.content) + "\"" : "no file");
    ScratchRoot scratch;
    if (row.content != nullptr) scratch.writeFile(kMultiUser, row.content);
    LinuxKeyBag keyBag(scratch.root());
    ASSERT_TRUE(keyBag.userTypeInfo().has_value());
    EXPECT_EQ(keyBag.userTypeInfo()->deviceMode,
              row.content != nullptr ? DeviceMode::MultiUser : DeviceMode::SingleUser);
    std::string error;
    EXPECT_EQ(keyBag.userSessionIds(&error), row.expected);
    if (!row.expected) {
      EXPECT_FALSE(error.empty());
      if (row.content != nullptr) {
        EXPECT_NE(error.find(scratch.resolve(kMultiUser)), std::string::npos) << error;
      }
    }
  }
}

}  // namespace
}  // namespace kestrel::platform
