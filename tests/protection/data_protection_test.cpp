// Moving a data container to another protection class: what changes on a
// real tree, what never does, and when the answer comes on a locked device.
#include "protection/data_protection_manager.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <map>

#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "platform/data_protection.h"
#include "platform/unique_fd.h"
#include "support/store_test_helpers.h"
#include "support/tmpfs_mount.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr const char* kApp = "com.example.app";

class DataProtectionChangeTest : public testing::StoreTest {
 protected:
  DataProtectionChangeTest() {
    EXPECT_TRUE(KSTCreateWorkQueues());
    app = make(501, 2, kApp);
  }

  // Items beneath the container, with the class each starts in (none: no class).
  void writeTree(const std::map<std::string, std::optional<std::int32_t>>& items) {
    for (const auto& [name, protectionClass] : items) {
      const std::string path = at(name);
      if (name.ends_with("/")) {
        fs::create_directories(path);
      } else {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path) << name;
      }
      if (protectionClass) setClass(path, *protectionClass);
    }
  }
  static void setClass(const std::string& path, std::int32_t protectionClass) {
    const platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW));
    ASSERT_EQ(platform::setProtectionClassOfNewFile(fd.get(), protectionClass), 0) << path;
  }
  std::string at(const std::string& name) const { return app->url().path() + "/" + name; }

  // Asks for the class and gives the code, once it came (or 0 after 20 s).
  std::future<std::uint64_t> ask(std::int32_t protectionClass, bool retryIfLocked = false,
                                 bool thirdParty = false, KSTContainerClass containerClass = 2,
                                 std::optional<std::string> identifier = kApp) {
    auto answer = std::make_shared<std::promise<std::uint64_t>>();
    KSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
        501, identifier, containerClass, protectionClass, thirdParty, retryIfLocked,
        [answer](std::uint64_t code) { answer->set_value(code); });
    return answer->get_future();
  }
  static std::uint64_t codeOf(std::future<std::uint64_t> answer) {
    return answer.wait_for(20s) == std::future_status::ready ? answer.get() : 0;
  }
  std::optional<std::int64_t> recorded() const {
    const auto info = testing::existingContainer(501, 2, kApp)->info();
    if (!info || !info->count(kKSTContentProtectionClassInfoKey)) return std::nullopt;
    return info->at(kKSTContentProtectionClassInfoKey).signedInteger();
  }
  void lock(bool locked) {
    fakes.keyBag->setLockState(locked ? 1 : 0);
    KSTLockStateChanged();
  }

  KSTMetadataRef app;
};

TEST_F(DataProtectionChangeTest, DirectoriesAndFilesMoveButClassTwoLinksAndOtherFileSystemsStay) {
  const std::string outside = fakes.scratch.resolve("/private/var/outside");
  std::ofstream(outside) << "not the app's";
  setClass(outside, 3);
  testing::TmpfsMount mount(at("Library/mnt"));
  ASSERT_TRUE(mount.mounted()) << mount.error();
  writeTree({{"Documents/plain", std::nullopt},
             {"Documents/one", 1},
             {"Documents/two", 2},
             {"Documents/kept/", 2},
             {"Documents/kept/inner", 3},
             {"Library/mnt/elsewhere", 3},
             {"tmp/zero", 0}});
  setClass(at("Library/mnt"), 3);
  fs::create_symlink(outside, at("Library/link"));

  const struct {
    std::int32_t to;
    std::map<std::string, std::int32_t> expected;
  } steps[] = {
      // 3 -> 1 (type 7): everything moves, but class 2 stays, and no file's
      // number goes up (0 stays 0).
      {1,
       {{"Documents", 1},
        {"Documents/plain", 1},
        {"Documents/one", 1},
        {"Documents/two", 2},
        {"Documents/kept", 2},
        {"Documents/kept/inner", 1},
        {"Library", 1},
        {"tmp/zero", 0}}},
      // 1 -> 3 (type 1): directories only; files keep what they have.
      {3,
       {{"Documents", 3},
        {"Documents/plain", 1},
        {"Documents/kept", 2},
        {"Documents/kept/inner", 1},
        {"Library", 3},
        {"Library/Preferences", 3},
        {"tmp", 3}}},
  };
  for (const auto& step : steps) {
    SCOPED_TRACE(step.to);
    ASSERT_EQ(codeOf(ask(step.to)), kKSTSuccess);
    for (const auto& [name, protectionClass] : step.expected) {
      EXPECT_EQ(testing::protectionClassOf(at(name)), protectionClass) << name;
    }
    // Another file system and the target of a link are not the container's.
    EXPECT_EQ(testing::protectionClassOf(at("Library/mnt")), 3);
    EXPECT_EQ(testing::protectionClassOf(at("Library/mnt/elsewhere")), 3);
    EXPECT_EQ(testing::protectionClassOf(outside), 3);
    EXPECT_EQ(recorded(), step.to);
  }
}

TEST_F(DataProtectionChangeTest, RequestsThatCannotBeCarriedOutAreAnsweredAtOnce) {
  const struct {
    const char* label;
    std::int32_t to;
    bool thirdParty;
    KSTContainerClass containerClass;
    std::optional<std::string> identifier;
    std::uint64_t code;
  } rows[] = {
      {"no identifier", 1, false, 2, std::nullopt, kKSTErrorInvalidObject},
      {"a bundle class", 1, false, 1, kApp, kKSTErrorInvalidObject},
      {"no such container", 1, false, 2, "com.example.none", kKSTErrorNotFound},
      {"class 2", 2, false, 2, kApp, kKSTErrorInvalidParameter},
      {"class 4 for a third-party app", 4, true, 2, kApp, kKSTErrorInvalidParameter},
      {"class 3, as recorded (none: 3)", 3, false, 2, kApp, kKSTSuccess},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.label);
    std::future<std::uint64_t> answer =
        ask(row.to, false, row.thirdParty, row.containerClass, row.identifier);
    ASSERT_EQ(answer.wait_for(0s), std::future_status::ready);
    EXPECT_EQ(answer.get(), row.code);
  }
  EXPECT_FALSE(fakes.logged("Setting protection class"));
  EXPECT_FALSE(recorded());
}

TEST_F(DataProtectionChangeTest, ALockedDeviceAnswersAfterTheNextUnlockOnlyWhenAskedToRetry) {
  writeTree({{"Documents/file", std::nullopt}});
  lock(true);
  EXPECT_EQ(codeOf(ask(1)), kKSTErrorDeviceLocked);
  EXPECT_TRUE(fakes.applicationLifecycle->acquisitions().empty());

  std::future<std::uint64_t> answer = ask(1, true);
  EXPECT_EQ(answer.wait_for(200ms), std::future_status::timeout);
  lock(false);
  EXPECT_EQ(codeOf(std::move(answer)), kKSTSuccess);
  EXPECT_EQ(testing::protectionClassOf(at("Documents/file")), 1);
  EXPECT_EQ(recorded(), 1);
  // The app was held terminated from the retry to the end.
  ASSERT_EQ(fakes.applicationLifecycle->acquisitions().size(), 1u);
  EXPECT_EQ(fakes.applicationLifecycle->acquisitions()[0].signingIdentifier, kApp);
  EXPECT_EQ(fakes.applicationLifecycle->invalidations(), 1u);
  EXPECT_FALSE(fakes.applicationLifecycle->isHeldTerminated(kApp));
}

TEST_F(DataProtectionChangeTest, AContainerThatMovedWhileWaitingIsLeftAlone) {
  lock(true);
  std::future<std::uint64_t> answer = ask(1, true);
  // Deleted and made anew (as an update would): another directory.
  std::uint64_t code = kKSTSuccess;
  installer.deleteContainerForUser(501, kApp, 2, false, &code);
  ASSERT_EQ(code, kKSTSuccess);
  const KSTMetadataRef fresh = make(501, 2, kApp);
  ASSERT_NE(fresh->url(), app->url());
  lock(false);
  EXPECT_EQ(codeOf(std::move(answer)), kKSTErrorInvalidURL);
  EXPECT_EQ(testing::protectionClassOf(fresh->url().path() + "/Documents"), std::nullopt);
  EXPECT_FALSE(recorded());
}

}  // namespace
}  // namespace kestrel
