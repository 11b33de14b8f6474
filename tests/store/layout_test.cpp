#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

#include "daemon/log.h"
#include "platform/data_protection.h"
#include "platform/unique_fd.h"
#include "store/container_class.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class LayoutTest : public ::testing::Test {
 protected:
  LayoutTest() {
    // The installer's home exists on a real system; its Library does not.
    fs::create_directories(fakes.scratch.resolve("/private/var/tesseld"));
  }

  KSTGlobalConfiguration& global() { return KSTGlobalConfiguration::sharedInstance(); }
  std::string sys(std::string_view path) const { return fakes.scratch.resolve(path); }
  // The home directories are resolved; the scratch root may lie behind a link.
  std::string home(std::string_view path) const { return fs::canonical(sys(path)).string(); }

  static uid_t ownerOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st.st_uid;
  }
  static mode_t modeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
  }
  static std::optional<std::int32_t> protectionClassOf(const std::string& path) {
    const platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY));
    std::optional<std::int32_t> protectionClass;
    EXPECT_EQ(platform::getProtectionClass(fd.get(), &protectionClass), 0) << path;
    return protectionClass;
  }
  bool loggedStartingWith(const std::string& prefix) const {
    for (const auto& line : fakes.logging->lines()) {
      if (line.level == platform::kLogError && line.message.rfind(prefix, 0) == 0) return true;
    }
    return false;
  }
  testing::FakeServices fakes;
};

TEST(ContainerClassTest, UserIdValidityFollowsTheClassKind) {
  struct Row {
    KSTContainerClass containerClass;
    std::uint32_t userId;
    bool valid;
  };
  // The request-level checks cover the common pairs; these are the remaining kinds.
  const Row rows[] = {
      {8, 33, true},   {8, 0, false},   {13, 33, false},
      {7, 499, false}, {99, 33, false}, {11, 4294967294U, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::Message() << "class " << row.containerClass << " user " << row.userId);
    EXPECT_EQ(KSTUserIdIsValidForClass(row.containerClass, row.userId), row.valid);
  }
}

TEST_F(LayoutTest, ClassDirectoriesLieWhereTheirKindSaysWithTheirOwner) {
  struct Row {
    std::uint32_t user;
    KSTContainerClass containerClass;
    bool transient;
    std::string path;
    uid_t owner;
  };
  const Row rows[] = {
      {33, 1, false, sys("/private/var/containers/Bundle/Application"), 33},
      {33, 3, true,
       sys("/private/var/tesseld/Library/Caches/com.zorvane.kestreld/Bundle/VantlerPlugin"), 33},
      {499, 13, false, sys("/private/var/containers/Shared/SystemGroup"), 0},
      {499, 12, true, sys("/private/var/root/Library/Caches/com.zorvane.kestreld/Temp/Data/System"),
       0},
      {501, 9, true,
       home("/private/var/mobile") + "/Library/Caches/com.zorvane.kestreld/Temp/Data/VexelService",
       501},
      {502, 2, false, home("/private/var/mobile2") + "/Containers/Data/Application", 502},
      {501, 7, false, home("/private/var/mobile") + "/Containers/Shared/AppGroup", 501},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::Message() << "class " << row.containerClass << " user " << row.user
                                      << (row.transient ? " transient" : ""));
    const auto url =
        global().containerDirectoryURLForUser(row.user, row.containerClass, row.transient);
    ASSERT_TRUE(url.has_value());
    EXPECT_EQ(url->path(), row.path);
    EXPECT_TRUE(url->isDirectory());
    EXPECT_TRUE(fs::is_directory(row.path));
    EXPECT_EQ(ownerOf(row.path), row.owner);
    EXPECT_EQ(modeOf(row.path), 0755u);
  }
  // Each level beneath the installer's home belongs to the installer.
  for (const char* level : {"/private/var/tesseld/Library", "/private/var/tesseld/Library/Caches",
                            "/private/var/tesseld/Library/Caches/com.zorvane.kestreld"}) {
    EXPECT_EQ(ownerOf(sys(level)), 33u) << level;
  }
  EXPECT_FALSE(loggedStartingWith("Failed to create"));
}

TEST_F(LayoutTest, ClassesWithoutAPerUserDirectoryGiveNone) {
  struct Row {
    std::uint32_t user;
    KSTContainerClass containerClass;
    const char* logged;
  };
  const Row rows[] = {
      {501, 14, "Invalid class for a per user container directory: 14"},
      {500, 2, "userId: 500 must be in range"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.logged);
    fakes.logging->clear();
    EXPECT_FALSE(global().containerDirectoryURLForUser(row.user, row.containerClass, false));
    EXPECT_TRUE(fakes.logging->containsMessage(row.logged));
  }
}

TEST_F(LayoutTest, MissingMobileAccountLeavesTheCurrentUserAtZero) {
  fakes.accounts->removeUser("mobile");
  EXPECT_EQ(global().currentMobileUserId(), 0u);
  EXPECT_TRUE(fakes.logging->containsMessage("Failed to get mobile uid. This is bad"));
  EXPECT_EQ(global().getPerUserConfigurationForCurrentMobileUser(), nullptr);
}

TEST_F(LayoutTest, MissingAccountGivesAConfigurationWithoutHome) {
  auto configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_NE(configuration, nullptr);
  EXPECT_TRUE(fakes.logging->containsMessage("Failed to getpwuid for uid: 503"));
  EXPECT_FALSE(configuration->userBaseDirectory());
  EXPECT_FALSE(global().containerDirectoryURLForUser(503, 2, true));
  // Kept: the account is not looked up again.
  fakes.logging->clear();
  EXPECT_EQ(global().getPerUserConfigurationForUserId(503), configuration);
  EXPECT_FALSE(fakes.logging->containsMessage("Failed to getpwuid for uid: 503"));
}

TEST_F(LayoutTest, HomeDirectoryIsResolvedAndAskingAboutItMakesNothing) {
  fs::create_directories(sys("/private/var/users/third"));
  fs::create_directory_symlink("users/third", sys("/private/var/third"));
  fakes.accounts->addUser("third", 503, 503, "/private/var/third");

  auto configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_NE(configuration, nullptr);
  ASSERT_TRUE(configuration->userHomeDirectory());
  EXPECT_EQ(configuration->userHomeDirectory()->path(), home("/private/var/users/third"));
  EXPECT_TRUE(configuration->existsUserBaseDirectory());
  EXPECT_FALSE(fs::exists(sys("/private/var/users/third/Containers")));

  // The backup directory is named, never made.
  const std::string base = home("/private/var/users/third");
  EXPECT_EQ(configuration->systemContainerBackupDirectory()->path(),
            base + "/Library/Backup/SystemContainers/Data");
  EXPECT_FALSE(fs::exists(base + "/Library"));

  ASSERT_TRUE(configuration->userBaseDirectory());
  EXPECT_EQ(ownerOf(base + "/Containers"), 503u);

  // A home that is gone: the user no longer "exists", and nothing makes it again.
  fs::remove_all(sys("/private/var/users/third"));
  EXPECT_FALSE(configuration->existsUserBaseDirectory());
  EXPECT_FALSE(fs::exists(sys("/private/var/users/third")));
}

TEST_F(LayoutTest, DaemonDirectoriesAreMadeWithTheirClassAndMadeAgainWhenRemoved) {
  struct Row {
    const char* name;
    KSTFileURL url;
    std::string path;
    std::optional<std::int32_t> protectionClass;
  };
  const std::string caches = sys("/private/var/root/Library/Caches/com.zorvane.kestreld");
  const std::string library = sys("/private/var/root/Library/Kestrel");
  const Row rows[] = {
      {"caches", global().cachesDirectory(), caches, 4},
      {"staging", global().stagingDirectory(), caches + "/Staging", {}},
      {"deathrow", global().deathrowDirectory(), caches + "/Dead", {}},
      {"library", global().libraryDirectory(), library, 4},
      {"replace", global().replaceDirectory(), library + "/Replace", {}},
      {"log", global().logDirectory(), sys("/private/var/root/Library/Logs/Kestrel"), 4},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    EXPECT_EQ(row.url.path(), row.path);
    EXPECT_EQ(modeOf(row.path), 0755u);
    EXPECT_EQ(protectionClassOf(row.path), row.protectionClass);
  }
  EXPECT_FALSE(loggedStartingWith("Failed to create"));

  fs::remove_all(sys("/private/var/root/Library"));
  EXPECT_EQ(global().stagingDirectory().path(), caches + "/Staging");
  EXPECT_TRUE(fs::is_directory(caches + "/Staging"));
  EXPECT_EQ(global().replaceDirectory().path(), library + "/Replace");
  EXPECT_TRUE(fs::is_directory(library + "/Replace"));
}

TEST_F(LayoutTest, DirectoryThatCannotBeMadeIsLoggedAndStillReturned) {
  // A file where the shared containers directory belongs: nothing beneath it can be made.
  fakes.scratch.writeFile("/private/var/containers", "not a directory");
  const std::string shared = sys("/private/var/containers");

  EXPECT_EQ(global().bundleDirectory().path(), shared + "/Bundle");
  EXPECT_TRUE(loggedStartingWith("Failed to create bundle dir at \"" + shared + "/Bundle\": "));

  const auto classDirectory = global().containerDirectoryURLForUser(499, 12, false);
  ASSERT_TRUE(classDirectory);
  EXPECT_EQ(classDirectory->path(), shared + "/Data/System");
  EXPECT_TRUE(
      loggedStartingWith("Failed to create container dir at \"" + shared + "/Data/System\": "));
}

TEST_F(LayoutTest, TransientBundleLevelsAreMadeOneByOneWithoutParents) {
  fs::remove(sys("/private/var/tesseld"));
  const std::string expected = sys("/private/var/tesseld/Library/Caches/com.zorvane.kestreld");
  EXPECT_EQ(global().transientBundleDirectory().path(), expected);
  EXPECT_EQ(fakes.countLogged("Failed to create transient bundle dir at ", testing::Match::Prefix),
            3u);
  EXPECT_FALSE(fs::exists(sys("/private/var/tesseld")));

  // Once the installer's home is there, the next call makes the levels.
  fs::create_directories(sys("/private/var/tesseld"));
  EXPECT_EQ(global().transientBundleDirectory().path(), expected);
  EXPECT_EQ(ownerOf(expected), 33u);
}

TEST_F(LayoutTest, LockedDeviceStillGetsItsDirectoriesNamed) {
  fakes.keyBag->setLockState(1);  // The class of the caches directory cannot be set.
  const std::string caches = sys("/private/var/root/Library/Caches/com.zorvane.kestreld");
  EXPECT_EQ(global().stagingDirectory().path(), caches + "/Staging");
  EXPECT_TRUE(loggedStartingWith("Failed to create cache dir at \"" + caches + "\": "));
  EXPECT_TRUE(fs::is_directory(caches + "/Staging"));
}

using LayoutConcurrencyTest = LayoutTest;

TEST_F(LayoutConcurrencyTest, CallersShareOneConfigurationPerUser) {
  constexpr int kThreads = 8;
  std::vector<std::shared_ptr<KSTPerUserConfiguration>> seen(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([this, t, &seen] {
      for (int i = 0; i < 20; ++i) {
        const KSTContainerClass containerClass = 1 + static_cast<KSTContainerClass>((t + i) % 13);
        const std::uint32_t user = KSTIsBundleClass(containerClass)   ? 33
                                   : KSTIsSystemClass(containerClass) ? 499
                                                                      : 501 + (i % 2);
        EXPECT_TRUE(global().containerDirectoryURLForUser(user, containerClass, (i % 3) == 0));
        (void)global().logDirectory();
      }
      seen[t] = global().getPerUserConfigurationForUserId(501);
    });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& configuration : seen) EXPECT_EQ(configuration, seen.front());
  EXPECT_FALSE(loggedStartingWith("Failed to create"));
}

}  // namespace
}  // namespace kestrel
