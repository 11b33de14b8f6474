#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <set>
#include <thread>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "daemon/request_dispatch.h"
#include "platform/unique_fd.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

// Sets or clears the append-only flag: even root cannot unlink such a file,
// and removal only knows how to lift the immutable flag.
int setAppendOnly(const std::string& path, bool on) {
  platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return errno;
  int flags = 0;
  if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return errno;
  flags = on ? (flags | FS_APPEND_FL) : (flags & ~FS_APPEND_FL);
  return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) != 0 ? errno : 0;
}

class DeathRowTest : public ::testing::Test {
 protected:
  ~DeathRowTest() override {
    // Nothing of a sweep may run on once the fakes are gone.
    KSTDeathRowQueue()->sync([] {});
    // The scratch root cannot go while a file in it is append-only, wherever it was moved.
    if (appendOnly_.empty()) return;
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(fakes.scratch.path(), ec);
         !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
      if (appendOnly_.count(it->path().filename())) setAppendOnly(it->path().string(), false);
    }
  }

  std::string deathRow() {
    return KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  }
  std::string tmp() const { return fakes.scratch.resolve("/tmp"); }

  static void makeTree(const std::string& path) {
    fs::create_directories(path + "/Library/Preferences");
    std::ofstream(path + "/Library/Preferences/a.plist") << "a";
    std::ofstream(path + "/Documents") << "b";
  }

  // A tree that removal cannot take away: it holds an append-only file.
  void makeStuckTree(const std::string& path) {
    makeTree(path);
    const std::string file = path + "/Library/stuck.db";
    std::ofstream(file) << "c";
    const int status = setAppendOnly(file, true);
    if (status != 0) GTEST_SKIP() << "append-only flag not supported here: " << status;
    appendOnly_.insert("stuck.db");
  }

  std::uint64_t sweep() {
    auto done = std::make_shared<std::promise<std::uint64_t>>();
    std::future<std::uint64_t> result = done->get_future();
    client.deleteContainersOnDeathRowWithCompletion(
        [done](std::uint64_t code) { done->set_value(code); });
    if (result.wait_for(20s) != std::future_status::ready) {
      ADD_FAILURE() << "the sweep did not end";
      return 0;
    }
    return result.get();
  }

  std::vector<std::string> entries(const std::string& directory) const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(directory))
      names.push_back(entry.path().filename());
    std::sort(names.begin(), names.end());
    return names;
  }

  testing::FakeServices fakes;
  KSTClientConnection client{std::string("com.example.installer"), true};

 private:
  std::set<std::string> appendOnly_;
};

TEST_F(DeathRowTest, SweepEmptiesDeathRowUnderATransactionOnTheBackgroundQueue) {
  makeTree(deathRow() + "/0A1B2C3D-UUID");
  makeTree(deathRow() + "/temp.abcdef/Data");
  std::ofstream(deathRow() + "/loose-file") << "x";
  fs::create_symlink(fakes.scratch.resolve("/private/var/mobile"), deathRow() + "/link");

  auto done = std::make_shared<std::promise<void>>();
  std::uint64_t code = 0, openDuringSweep = 0;
  bool onDeathRowQueue = false, onBackgroundPool = false;
  client.deleteContainersOnDeathRowWithCompletion([&, done](std::uint64_t result) {
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
  EXPECT_TRUE(entries(deathRow()).empty());
  EXPECT_TRUE(
      fs::is_directory(fakes.scratch.resolve("/private/var/mobile")));  // links are not followed
  EXPECT_EQ(openDuringSweep, 1u);
  EXPECT_TRUE(onDeathRowQueue);
  EXPECT_TRUE(onBackgroundPool);
  EXPECT_EQ(fakes.keepAlive->openTransactions(), 0u);
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 1u);
}

TEST_F(DeathRowTest, EntryThatCannotBeRemovedGoesToTmp) {
  fs::create_directories(tmp());
  makeStuckTree(deathRow() + "/stuck");
  if (IsSkipped()) return;
  makeTree(deathRow() + "/other");

  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_TRUE(entries(deathRow()).empty());
  EXPECT_TRUE(fs::exists(tmp() + "/stuck/Library/stuck.db"));
  EXPECT_FALSE(fs::exists(tmp() + "/other"));
  EXPECT_TRUE(fakes.logged("Couldn't remove, so moving item to /tmp: " + deathRow() + "/stuck : ",
                           testing::Match::Contains, "_removeItemOrMoveToTempAtURL"));
}

TEST_F(DeathRowTest, EntryThatCanNeitherBeRemovedNorMovedFailsTheSweepButNotTheOthers) {
  std::ofstream(tmp()) << "/tmp is a file here";
  makeTree(deathRow() + "/first");
  makeStuckTree(deathRow() + "/stuck");
  if (IsSkipped()) return;
  makeTree(deathRow() + "/last");
  std::ofstream(deathRow() + "/loose") << "x";

  EXPECT_EQ(sweep(), kKSTErrorDestroyFailed);
  EXPECT_EQ(entries(deathRow()), std::vector<std::string>{"stuck"});
  EXPECT_TRUE(fakes.logged("Failed to destroy item at: " + deathRow() + "/stuck"));

  // The next sweep finds the entry again, and takes it once it can.
  setAppendOnly(deathRow() + "/stuck/Library/stuck.db", false);
  EXPECT_EQ(sweep(), kKSTSuccess);
  EXPECT_TRUE(entries(deathRow()).empty());
}

TEST_F(DeathRowTest, RemoveOrMoveToTmpFailsWithTheMovesError) {
  KSTErrorRef error;
  std::ofstream(tmp()) << "/tmp is a file here";
  const std::string stuck = fakes.scratch.resolve("/private/var/stuck");
  makeStuckTree(stuck);
  if (IsSkipped()) return;
  EXPECT_FALSE(client._removeItemOrMoveToTempAtURL(KSTFileURL(stuck, true), &error));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), kKSTErrorMoveToTempFailed);
  EXPECT_EQ(error->localizedDescription(), "Failed to move dir: " + stuck + " to: " + tmp());
  ASSERT_NE(error->underlyingError(), nullptr);
  EXPECT_TRUE(error->underlyingError()->isPOSIXError(ENOTDIR));
}

TEST_F(DeathRowTest, MovesToDeathRowGetAHolderEach) {
  const std::string first = fakes.scratch.resolve("/private/var/one/Data");
  const std::string second = fakes.scratch.resolve("/private/var/two/Data");
  makeTree(first);
  fs::create_directories(second);
  std::ofstream(second + "/marker") << "second";

  KSTErrorRef error;
  EXPECT_TRUE(client._moveItemAtURLToDeathRow(KSTFileURL(first, true), true, false, &error));
  EXPECT_EQ(error, nullptr);
  EXPECT_TRUE(client._moveItemAtURLToDeathRow(KSTFileURL(second, true), true, false, &error));
  EXPECT_EQ(error, nullptr);

  EXPECT_FALSE(fs::exists(first));
  EXPECT_FALSE(fs::exists(second));
  const std::vector<std::string> holders = entries(deathRow());
  ASSERT_EQ(holders.size(), 2u);
  for (const std::string& holder : holders) {
    EXPECT_EQ(holder.rfind("temp.", 0), 0u);
    EXPECT_EQ(entries(deathRow() + "/" + holder), std::vector<std::string>{"Data"});
  }
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);  // no sweep was asked for
}

TEST_F(DeathRowTest, MoveWithDeletionStartsASweepUnlessTheItemIsMissing) {
  KSTErrorRef error;
  EXPECT_TRUE(client._moveItemAtURLToDeathRow(
      KSTFileURL(fakes.scratch.resolve("/private/var/gone"), true), true, true, &error));
  EXPECT_EQ(error, nullptr);
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);
  ASSERT_EQ(entries(deathRow()).size(), 1u);  // the empty holder stays for the next sweep

  const std::string item = fakes.scratch.resolve("/private/var/old/Container");
  makeTree(item);
  EXPECT_TRUE(client._moveItemAtURLToDeathRow(KSTFileURL(item, true), true, true, &error));
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 1u);
  EXPECT_TRUE(entries(deathRow()).empty());
}

TEST_F(DeathRowTest, MoveToDeathRowFailures) {
  // The destination lies inside the item itself.
  const KSTFileURL caches = KSTGlobalConfiguration::sharedInstance().cachesDirectory();
  KSTErrorRef error;
  EXPECT_FALSE(client._moveItemAtURLToDeathRow(caches, true, true, &error));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), kKSTErrorDeathRowMoveFailed);
  const std::string description = error->localizedDescription().value_or("");
  EXPECT_EQ(description.rfind(
                "Failed to move item at: " + caches.path() + " to: " + deathRow() + "/temp.", 0),
            0u)
      << description;
  EXPECT_TRUE(error->underlyingError() && error->underlyingError()->isPOSIXError(EINVAL));
  EXPECT_TRUE(fs::is_directory(caches.path()));

  // No holder can be made.
  const std::string item = fakes.scratch.resolve("/private/var/item");
  fs::create_directories(item);
  const std::string path = deathRow();
  fs::remove_all(path);
  std::ofstream(path) << "not a directory";
  EXPECT_FALSE(client._moveItemAtURLToDeathRow(KSTFileURL(item, true), true, true, &error));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), kKSTErrorDeathRowMoveFailed);
  EXPECT_EQ(error->localizedDescription(), "Failed to create unique directory at: " + item);
  EXPECT_TRUE(fs::is_directory(item));
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);
}

TEST_F(DeathRowTest, CommandRepliesWithTheSweepsCodeOnceItEnded) {
  ASSERT_TRUE(KSTStartRequestListener(platform::DispatchQueue::createConcurrent("test.listener")));
  auto connection = fakes.connectAllowedClient();
  platform::MessageDictionary request;
  request.setUint64(kKSTCommandKey, 4);

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
  EXPECT_TRUE(entries(deathRow()).empty());

  // A failed sweep (death row cannot be listed) is the reply's code.
  const std::string path = deathRow();
  fs::remove_all(path);
  std::ofstream(path) << "not a directory";
  ASSERT_TRUE(connection->deliver(request));
  ASSERT_TRUE(connection->waitForReplies(2, 20s));
  EXPECT_EQ(connection->lastReply()->uint64(kKSTReplyErrorKey), kKSTErrorDeleteFailed);
  EXPECT_TRUE(fakes.logged("Failed to get items for deletion: " + path + " : "));
}

}  // namespace
}  // namespace kestrel
