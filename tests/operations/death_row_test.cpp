#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>

#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "platform/file_system.h"
#include "platform/unique_fd.h"
#include "store/global_configuration.h"
#include "support/store_test_helpers.h"
#include "support/tmpfs_mount.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using testing::namesIn;
using Strings = std::vector<std::string>;

// Sets the append-only flag: a file that has it cannot be renamed or unlinked
// until it is cleared.
int setAppendOnly(const std::string& path) {
  platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return errno;
  int flags = 0;
  if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return errno;
  flags |= FS_APPEND_FL;
  return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) != 0 ? errno : 0;
}

class DeathRowTest : public testing::StoreTest {
 protected:
  ~DeathRowTest() override {
    // Nothing of a sweep may run on once the fakes are gone.
    KSTDeathRowQueue()->sync([] {});
  }
  static std::string deathRow() {
    return KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  }
  std::string tmp() const { return fakes.scratch.resolve("/tmp"); }
  static void makeTree(const std::string& path) {
    fs::create_directories(path + "/Library/Preferences");
    std::ofstream(path + "/Library/Preferences/a.plist") << "a";
    std::ofstream(path + "/Documents") << "b";
  }
  // A tree that no removal can take away: a file system is mounted in it.
  testing::TmpfsMount& makeStuckTree(const std::string& path) {
    makeTree(path);
    auto& mount =
        mounts_.emplace_back(std::make_unique<testing::TmpfsMount>(path + "/Library/mnt"));
    if (!mount->mounted()) ADD_FAILURE() << "cannot mount: " << mount->error();
    return *mount;
  }
  // A tmpfs on the root's /tmp, as on most Linux systems.
  void mountTmp() {
    auto& mount = mounts_.emplace_back(std::make_unique<testing::TmpfsMount>(tmp()));
    if (!mount->mounted()) ADD_FAILURE() << "cannot mount: " << mount->error();
  }
  std::uint64_t sweep() {
    auto done = std::make_shared<std::promise<std::uint64_t>>();
    std::future<std::uint64_t> result = done->get_future();
    installer.deleteContainersOnDeathRowWithCompletion(
        [done](std::uint64_t code) { done->set_value(code); });
    if (result.wait_for(20s) != std::future_status::ready) {
      ADD_FAILURE() << "the sweep did not end";
      return 0;
    }
    return result.get();
  }
  bool moveToDeathRow(const std::string& item, bool deleteAfterwards, KSTErrorRef* error) {
    return installer._moveItemAtURLToDeathRow(KSTFileURL(item, true), true, deleteAfterwards,
                                              error);
  }
  // Death row as a file: nothing can be listed or made in it.
  static std::string replaceDeathRowWithAFile() {
    const std::string path = deathRow();  // asking again would make it again
    fs::remove_all(path);
    std::ofstream(path) << "not a directory";
    return path;
  }

 private:
  // Unmounted before the scratch root goes.
  std::vector<std::unique_ptr<testing::TmpfsMount>> mounts_;
};

TEST_F(DeathRowTest, SweepEmptiesDeathRowUnderATransactionOnTheBackgroundQueue) {
  makeTree(deathRow() + "/0A1B2C3D-UUID");
  makeTree(deathRow() + "/temp.abcdef/Data");
  std::ofstream(deathRow() + "/loose-file") << "x";
  fs::create_symlink(fakes.scratch.resolve("/private/var/mobile"), deathRow() + "/link");
  auto done = std::make_shared<std::promise<void>>();
  std::uint64_t code = 0, openDuringSweep = 0;
  bool onDeathRowQueue = false, onBackgroundPool = false;
  installer.deleteContainersOnDeathRowWithCompletion([&, done](std::uint64_t result) {
    code = result;
    openDuringSweep = fakes.keepAlive->openTransactions();
    onDeathRowQueue = KSTDeathRowQueue()->isCurrent();
    onBackgroundPool =
        platform::DispatchQueue::global(platform::QueuePriority::Background)->isCurrent();
    done->set_value();
  });
  ASSERT_EQ(done->get_future().wait_for(20s), std::future_status::ready);
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(code, kKSTSuccess);
  EXPECT_TRUE(namesIn(deathRow()).empty());
  // Links are not followed.
  EXPECT_TRUE(fs::is_directory(fakes.scratch.resolve("/private/var/mobile")));
  EXPECT_EQ(openDuringSweep, 1u);
  EXPECT_TRUE(onDeathRowQueue);
  EXPECT_TRUE(onBackgroundPool);
  EXPECT_EQ(fakes.keepAlive->openTransactions(), 0u);
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 1u);
}

// /tmp on a file system of its own: an item that was made immutable or
// append-only loses the flag and goes, and no sweep leaves anything behind.
TEST_F(DeathRowTest, FlaggedItemsLoseTheirFlagAndGoWithTmpOnAnotherFileSystem) {
  mountTmp();
  makeTree(deathRow() + "/0A1B2C3D-UUID");
  std::ofstream(deathRow() + "/0A1B2C3D-UUID/Library/log.db") << "c";
  makeTree(deathRow() + "/temp.abcdef/Data");
  ASSERT_EQ(setAppendOnly(deathRow() + "/0A1B2C3D-UUID/Library/log.db"), 0);
  ASSERT_EQ(setAppendOnly(deathRow() + "/temp.abcdef/Data/Library"), 0);
  ASSERT_EQ(
      platform::lchflags((deathRow() + "/temp.abcdef").c_str(), platform::kFileFlagUserImmutable),
      0);
  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_TRUE(namesIn(deathRow()).empty());
  EXPECT_TRUE(namesIn(tmp()).empty());
  EXPECT_TRUE(fakes.logged("Unset UF_IMMUTABLE on " + deathRow() + "/0A1B2C3D-UUID/Library/log.db",
                           testing::Match::Exact, "_treeremove_error_callback"));
  EXPECT_EQ(sweep(), kKSTSuccess);
}

TEST_F(DeathRowTest, EntryThatCannotBeRemovedGoesToTmpInAHolderOfItsOwn) {
  makeStuckTree(deathRow() + "/stuck");
  makeTree(deathRow() + "/other");
  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_TRUE(namesIn(deathRow()).empty());
  const Strings holders = namesIn(tmp());
  ASSERT_EQ(holders.size(), 1u);
  EXPECT_TRUE(fs::is_directory(tmp() + "/" + holders[0] + "/stuck/Library/mnt"));
  EXPECT_TRUE(fakes.logged("Couldn't remove, so moving item to /tmp: " + deathRow() + "/stuck : ",
                           testing::Match::Contains, "_removeItemOrMoveToTempAtURL"));
  // Another of the same name does not collide with it.
  makeStuckTree(deathRow() + "/stuck");
  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_EQ(namesIn(tmp()).size(), 2u);
}

// Across file systems an item is copied and its source removed; when the
// source cannot be removed the move fails and its copy goes again, so every
// sweep answers alike and nothing piles up in /tmp.
TEST_F(DeathRowTest, EntryThatCannotBeRemovedNorMovedFailsEverySweepAlikeUntilItCanGo) {
  mountTmp();
  makeTree(deathRow() + "/first");
  testing::TmpfsMount& stuck = makeStuckTree(deathRow() + "/stuck");
  makeTree(deathRow() + "/last");
  for (int i = 0; i < 2; ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(sweep(), kKSTErrorDestroyFailed);
    EXPECT_EQ(namesIn(deathRow()), Strings{"stuck"});
    EXPECT_TRUE(namesIn(tmp()).empty());
  }
  EXPECT_TRUE(fakes.logged("Failed to destroy item at: " + deathRow() + "/stuck",
                           testing::Match::Contains, "deleteContainersOnDeathRowWithCompletion"));

  // Alone, it fails with the move's error, which is the failed removal of its source.
  KSTErrorRef error;
  const std::string path = deathRow() + "/stuck";
  EXPECT_FALSE(installer._removeItemOrMoveToTempAtURL(KSTFileURL(path, true), &error));
  EXPECT_TRUE(testing::isError(error, kKSTErrorMoveToTempFailed,
                               "Failed to move dir: " + path + " to: " + tmp()));
  EXPECT_TRUE(testing::isPOSIXError(error->underlyingError(), EBUSY));
  EXPECT_TRUE(namesIn(tmp()).empty());

  // The next sweep takes it once it can go.
  stuck.unmount();
  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_TRUE(namesIn(deathRow()).empty());
}

TEST_F(DeathRowTest, EntryThatCanNeitherBeRemovedNorMovedFailsTheSweepButNotTheOthers) {
  fs::remove(tmp());
  std::ofstream(tmp()) << "/tmp is a file here";
  makeTree(deathRow() + "/first");
  makeStuckTree(deathRow() + "/stuck");
  makeTree(deathRow() + "/last");
  std::ofstream(deathRow() + "/loose") << "x";
  EXPECT_EQ(sweep(), kKSTErrorDestroyFailed);
  EXPECT_EQ(namesIn(deathRow()), Strings{"stuck"});
  KSTErrorRef error;
  const std::string stuck = deathRow() + "/stuck";
  EXPECT_FALSE(installer._removeItemOrMoveToTempAtURL(KSTFileURL(stuck, true), &error));
  EXPECT_TRUE(testing::isPOSIXError(error->underlyingError(), ENOTDIR));
}

TEST_F(DeathRowTest, MovesToDeathRowGetAHolderEachAndStartASweepWhenAsked) {
  const std::string first = fakes.scratch.resolve("/private/var/one/Data");
  const std::string second = fakes.scratch.resolve("/private/var/two/Data");
  makeTree(first);
  fs::create_directories(second);
  KSTErrorRef error;
  EXPECT_TRUE(moveToDeathRow(first, false, &error));
  EXPECT_EQ(error, nullptr);
  EXPECT_TRUE(moveToDeathRow(second, false, &error));
  EXPECT_EQ(error, nullptr);
  EXPECT_FALSE(fs::exists(first));
  EXPECT_FALSE(fs::exists(second));
  const Strings holders = namesIn(deathRow());
  ASSERT_EQ(holders.size(), 2u);
  for (const std::string& holder : holders) {
    EXPECT_TRUE(holder.starts_with("temp.")) << holder;
    EXPECT_EQ(namesIn(deathRow() + "/" + holder), Strings{"Data"});
  }
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);  // no sweep was asked for

  // A missing item starts none either; its empty holder stays for the next sweep.
  EXPECT_TRUE(moveToDeathRow(fakes.scratch.resolve("/private/var/gone"), true, &error));
  EXPECT_EQ(error, nullptr);
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);
  EXPECT_EQ(namesIn(deathRow()).size(), 3u);
  const std::string item = fakes.scratch.resolve("/private/var/old/Container");
  makeTree(item);
  EXPECT_TRUE(moveToDeathRow(item, true, &error));
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 1u);
  EXPECT_TRUE(namesIn(deathRow()).empty());
}

TEST_F(DeathRowTest, MoveToDeathRowFailures) {
  // The destination lies inside the item itself.
  const KSTFileURL caches = KSTGlobalConfiguration::sharedInstance().cachesDirectory();
  KSTErrorRef error;
  EXPECT_FALSE(installer._moveItemAtURLToDeathRow(caches, true, true, &error));
  EXPECT_TRUE(testing::isError(error, kKSTErrorDeathRowMoveFailed));
  EXPECT_TRUE(testing::messageOf(error).starts_with("Failed to move item at: " + caches.path() +
                                                    " to: " + deathRow() + "/temp."))
      << testing::messageOf(error);
  EXPECT_TRUE(testing::isPOSIXError(error->underlyingError(), EINVAL));
  EXPECT_TRUE(fs::is_directory(caches.path()));
  // No holder can be made.
  const std::string item = fakes.scratch.resolve("/private/var/item");
  fs::create_directories(item);
  replaceDeathRowWithAFile();
  EXPECT_FALSE(moveToDeathRow(item, true, &error));
  EXPECT_TRUE(testing::isError(error, kKSTErrorDeathRowMoveFailed,
                               "Failed to create unique directory at: " + item));
  EXPECT_TRUE(fs::is_directory(item));
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);
}

TEST_F(DeathRowTest, CommandRepliesWithTheSweepsCodeOnceItEnded) {
  connectThroughDispatcher();
  const auto request = testing::request({{kKSTCommandKey, 4u}});
  makeTree(deathRow() + "/0A1B2C3D-UUID");
  // Held still, the queue shows that the dispatcher itself sends nothing.
  KSTDeathRowQueue()->suspend();
  ASSERT_TRUE(connection->deliver(request));
  EXPECT_TRUE(connection->replies().empty());
  EXPECT_EQ(connection->unansweredRequests(), 1u);
  KSTDeathRowQueue()->resume();
  ASSERT_TRUE(connection->waitForReplies(1, 20s));
  EXPECT_EQ(connection->lastReply()->uint64(kKSTReplyErrorKey), kKSTSuccess);
  EXPECT_EQ(connection->lastReply()->size(), 1u);
  EXPECT_TRUE(namesIn(deathRow()).empty());
  // A failed sweep (death row cannot be listed) is the reply's code.
  const std::string path = replaceDeathRowWithAFile();
  ASSERT_TRUE(connection->deliver(request));
  ASSERT_TRUE(connection->waitForReplies(2, 20s));
  EXPECT_EQ(connection->lastReply()->uint64(kKSTReplyErrorKey), kKSTErrorDeleteFailed);
  EXPECT_TRUE(fakes.logged("Failed to get items for deletion: " + path + " : ",
                           testing::Match::Contains, "deleteContainersOnDeathRowWithCompletion"));
}

}  // namespace
}  // namespace kestrel
