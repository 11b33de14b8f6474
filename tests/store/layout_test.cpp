#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <filesystem>
#include <thread>

#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "store/container_class.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::modeOf;
using testing::ownerOf;

class LayoutTest : public ::testing::Test {
 protected:
  LayoutTest() {
    // The installer's home exists on a real system; its Library does not.
    fs::create_directories(sys("/private/var/tesseld"));
  }
  KSTGlobalConfiguration& global() { return KSTGlobalConfiguration::sharedInstance(); }
  std::string sys(std::string_view path) const { return fakes.scratch.resolve(path); }
  // The home directories are resolved; the scratch root may lie behind a link.
  std::string home(std::string_view path) const { return fs::canonical(sys(path)).string(); }
  bool loggedStartingWith(const std::string& prefix) const {
    for (const auto& line : fakes.logging->lines()) {
      if (line.level == platform::kLogError && line.message.starts_with(prefix)) return true;
    }
    return false;
  }
  testing::FakeServices fakes;
};

TEST(ContainerClassTest, UserIdValidityFollowsTheClassKind) {
  // The request-level checks cover the common pairs; these are the remaining kinds.
  const std::tuple<KSTContainerClass, std::uint32_t, bool> rows[] = {
      {8, 33, true},   {8, 0, false},   {13, 33, false},
      {7, 499, false}, {99, 33, false}, {11, 4294967294U, true},
  };
  for (const auto& [containerClass, userId, valid] : rows) {
    SCOPED_TRACE(::testing::Message() << "class " << containerClass << " user " << userId);
    EXPECT_EQ(KSTUserIdIsValidForClass(containerClass, userId), valid);
  }
}

TEST_F(LayoutTest, ClassDirectoriesLieWhereTheirKindSaysWithTheirOwner) {
  const std::string mobile = home("/private/var/mobile");
  const std::tuple<std::uint32_t, KSTContainerClass, bool, std::string, uid_t> rows[] = {
      {33, 1, false, sys("/private/var/containers/Bundle/Application"), 33},
      {33, 3, true,
       sys("/private/var/tesseld/Library/Caches/com.zorvane.kestreld/Bundle/VantlerPlugin"), 33},
      {499, 13, false, sys("/private/var/containers/Shared/SystemGroup"), 0},
      {499, 12, true, sys("/private/var/root/Library/Caches/com.zorvane.kestreld/Temp/Data/System"),
       0},
      {501, 9, true, mobile + "/Library/Caches/com.zorvane.kestreld/Temp/Data/VexelService", 501},
      {502, 2, false, home("/private/var/mobile2") + "/Containers/Data/Application", 502},
      {501, 7, false, mobile + "/Containers/Shared/AppGroup", 501},
  };
  for (const auto& [user, containerClass, transient, path, owner] : rows) {
    SCOPED_TRACE(path);
    const auto url = global().containerDirectoryURLForUser(user, containerClass, transient);
    ASSERT_TRUE(url.has_value());
    EXPECT_EQ(url->path(), path);
    EXPECT_TRUE(url->isDirectory());
    EXPECT_TRUE(fs::is_directory(path));
    EXPECT_EQ(ownerOf(path), owner);
    EXPECT_EQ(modeOf(path), 0755u);
  }
  // Each level beneath the installer's home belongs to the installer.
  for (const char* level : {"/private/var/tesseld/Library", "/private/var/tesseld/Library/Caches",
                            "/private/var/tesseld/Library/Caches/com.zorvane.kestreld"}) {
    EXPECT_EQ(ownerOf(sys(level)), 33u) << level;
  }
  EXPECT_FALSE(loggedStartingWith("Failed to create"));

  // Classes without a per-user directory give none.
  EXPECT_FALSE(global().containerDirectoryURLForUser(501, 14, false));
  EXPECT_TRUE(
      fakes.logging->containsMessage("Invalid class for a per user container directory: 14"));
  EXPECT_FALSE(global().containerDirectoryURLForUser(500, 2, false));
  EXPECT_TRUE(fakes.logging->containsMessage("userId: 500 must be in range"));
}

TEST_F(LayoutTest, MissingAccountsGiveNoMobileUserAndNoHome) {
  fakes.accounts->removeUser("mobile");
  EXPECT_EQ(global().currentMobileUserId(), 0u);
  EXPECT_TRUE(fakes.logging->containsMessage("Failed to get mobile uid. This is bad"));
  EXPECT_EQ(global().getPerUserConfigurationForCurrentMobileUser(), nullptr);
  auto configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_NE(configuration, nullptr);
  EXPECT_TRUE(fakes.logging->containsMessage("Failed to getpwuid for uid: 503"));
  EXPECT_FALSE(configuration->userBaseDirectory());
  EXPECT_FALSE(global().containerDirectoryURLForUser(503, 2, true));

  // A home that does not resolve is no home either: nothing is made where it would be.
  fakes.accounts->addUser("third", 503, 503, "/private/var/third");
  configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_NE(configuration, nullptr);
  EXPECT_FALSE(configuration->userHomeDirectory());
  EXPECT_TRUE(loggedStartingWith("Failed to resolve home directory " + sys("/private/var/third")));
  EXPECT_FALSE(global().containerDirectoryURLForUser(503, 2, false));
  KSTClientConnection installer(std::string("com.example.installer"), 0, true, std::nullopt);
  std::uint64_t code = kKSTSuccess;
  EXPECT_FALSE(installer.createOrLookupContainerForUser(503, "com.example.app", true, 2, false,
                                                        true, &code));
  EXPECT_EQ(code, kKSTErrorCacheRebuildFailed);
  EXPECT_FALSE(fs::exists(sys("/private/var/third")));
  // Neither is kept: once the home is there, the next call finds it.
  fs::create_directories(sys("/private/var/third"));
  configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_TRUE(configuration->userHomeDirectory());
  EXPECT_EQ(global().getPerUserConfigurationForUserId(503), configuration);
  EXPECT_TRUE(global().containerDirectoryURLForUser(503, 2, false));
}

TEST_F(LayoutTest, HomeDirectoryIsResolvedAndAskingAboutItMakesNothing) {
  fs::create_directories(sys("/private/var/users/third"));
  fs::create_directory_symlink("users/third", sys("/private/var/third"));
  fakes.accounts->addUser("third", 503, 503, "/private/var/third");
  auto configuration = global().getPerUserConfigurationForUserId(503);
  ASSERT_NE(configuration, nullptr);
  const std::string base = home("/private/var/users/third");
  ASSERT_TRUE(configuration->userHomeDirectory());
  EXPECT_EQ(configuration->userHomeDirectory()->path(), base);
  EXPECT_TRUE(configuration->existsUserBaseDirectory());
  EXPECT_FALSE(fs::exists(base + "/Containers"));
  // The backup directory is named, never made.
  EXPECT_EQ(configuration->systemContainerBackupDirectory()->path(),
            base + "/Library/Backup/SystemContainers/Data");
  EXPECT_FALSE(fs::exists(base + "/Library"));
  ASSERT_TRUE(configuration->userBaseDirectory());
  EXPECT_EQ(ownerOf(base + "/Containers"), 503u);
  // A home that is gone: the user no longer "exists", and nothing makes it again.
  fs::remove_all(base);
  EXPECT_FALSE(configuration->existsUserBaseDirectory());
  EXPECT_FALSE(fs::exists(base));
}

TEST_F(LayoutTest, DaemonDirectoriesAreMadeWithTheirClassAndMadeAgainWhenRemoved) {
  const std::string caches = sys("/private/var/root/Library/Caches/com.zorvane.kestreld");
  const std::string library = sys("/private/var/root/Library/Kestrel");
  const std::tuple<KSTFileURL, std::string, std::optional<std::int32_t>> rows[] = {
      {global().cachesDirectory(), caches, 4},
      {global().stagingDirectory(), caches + "/Staging", {}},
      {global().deathrowDirectory(), caches + "/Dead", {}},
      {global().libraryDirectory(), library, 4},
      {global().replaceDirectory(), library + "/Replace", {}},
      {global().logDirectory(), sys("/private/var/root/Library/Logs/Kestrel"), 4},
  };
  for (const auto& [url, path, protectionClass] : rows) {
    SCOPED_TRACE(path);
    EXPECT_EQ(url.path(), path);
    EXPECT_EQ(modeOf(path), 0755u);
    EXPECT_EQ(testing::protectionClassOf(path), protectionClass);
  }
  EXPECT_FALSE(loggedStartingWith("Failed to create"));
  fs::remove_all(sys("/private/var/root/Library"));
  EXPECT_EQ(global().stagingDirectory().path(), caches + "/Staging");
  EXPECT_TRUE(fs::is_directory(caches + "/Staging"));
  EXPECT_EQ(global().replaceDirectory().path(), library + "/Replace");
  EXPECT_TRUE(fs::is_directory(library + "/Replace"));
}

TEST_F(LayoutTest, DirectoriesThatCannotBeMadeAreLoggedAndStillNamed) {
  // A file where the shared containers directory belongs: nothing beneath it can be made.
  fakes.scratch.writeFile("/private/var/containers", "not a directory");
  const std::string shared = sys("/private/var/containers");
  EXPECT_EQ(global().bundleDirectory().path(), shared + "/Bundle");
  EXPECT_TRUE(loggedStartingWith("Failed to create bundle dir at \"" + shared + "/Bundle\": "));
  EXPECT_EQ(global().containerDirectoryURLForUser(499, 12, false).value_or(KSTFileURL()).path(),
            shared + "/Data/System");
  EXPECT_TRUE(
      loggedStartingWith("Failed to create container dir at \"" + shared + "/Data/System\": "));

  // The caches directory cannot leave class 1 while locked.
  const std::string caches = sys("/private/var/root/Library/Caches/com.zorvane.kestreld");
  fs::create_directories(caches);
  const char classOne[4] = {1, 0, 0, 0};
  ASSERT_EQ(::setxattr(caches.c_str(), "trusted.kestrel.protection-class", classOne, 4, 0), 0);
  fakes.keyBag->setLockState(1);
  EXPECT_EQ(global().stagingDirectory().path(), caches + "/Staging");
  EXPECT_TRUE(loggedStartingWith("Failed to create cache dir at \"" + caches + "\": "));
  EXPECT_TRUE(fs::is_directory(caches + "/Staging"));

  // Without the installer's home, the transient bundle levels are tried one by
  // one, without parents; once it is there, the next call makes them.
  fs::remove(sys("/private/var/tesseld"));
  const std::string transient = sys("/private/var/tesseld/Library/Caches/com.zorvane.kestreld");
  EXPECT_EQ(global().transientBundleDirectory().path(), transient);
  EXPECT_EQ(fakes.countLogged("Failed to create transient bundle dir at ", testing::Match::Prefix),
            3u);
  EXPECT_FALSE(fs::exists(sys("/private/var/tesseld")));
  fs::create_directories(sys("/private/var/tesseld"));
  EXPECT_EQ(global().transientBundleDirectory().path(), transient);
  EXPECT_EQ(ownerOf(transient), 33u);
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
