#include "store/container_cache.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <stdexcept>
#include <thread>

#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::classDirectory;
using testing::isError;
using testing::messageOf;
using testing::writeContainer;
using Strings = std::vector<std::string>;

class ContainerCacheTest : public testing::StoreTest {
 protected:
  KSTContainerCache& cache() { return KSTContainerCache::sharedInstance(); }
  Strings identifiers(std::uint32_t user, KSTContainerClass containerClass,
                      bool transient = false) {
    KSTErrorRef error;
    auto ids = cache().allContainerIdentifiersForUser(user, containerClass, transient, &error);
    EXPECT_TRUE(ids.has_value()) << messageOf(error);
    Strings sorted = ids.value_or(Strings{});
    std::sort(sorted.begin(), sorted.end());
    return sorted;
  }
};

TEST_F(ContainerCacheTest, RebuildFromAJunkFilledDirectoryKeepsOnlyValidContainers) {
  writeContainer(501, 2, "com.example.a");
  writeContainer(501, 2, "com.example.b");
  const std::string dir = classDirectory(501, 2);
  ASSERT_EQ(::mkfifo((dir + "/fifo").c_str(), 0644), 0);
  fs::create_directory(dir + "/no-metadata");
  fs::create_directory(dir + "/unreadable");
  ::chmod((dir + "/unreadable").c_str(), 0);
  // Valid metadata of another user, of another class, and hidden.
  fs::rename(writeContainer(502, 2, "com.example.other-user")->url().path(), dir + "/other-user");
  fs::rename(writeContainer(501, 4, "com.example.plugin")->url().path(), dir + "/other-class");
  fs::rename(writeContainer(501, 2, "com.example.hidden")->url().path(), dir + "/.hidden");
  // A link to a valid container elsewhere is not followed.
  const std::string elsewhere = fakes.scratch.resolve("/private/var/elsewhere");
  fs::create_directories(elsewhere);
  fs::rename(writeContainer(501, 2, "com.example.linked")->url().path(), elsewhere + "/LINKED");
  fs::create_directory_symlink(elsewhere + "/LINKED", dir + "/link");
  fs::create_symlink("/nonexistent", dir + "/dangling");

  EXPECT_EQ(identifiers(501, 2), (Strings{"com.example.a", "com.example.b"}));
  auto all = cache().allContainersForUser(501, 2, false, nullptr);
  ASSERT_TRUE(all);
  EXPECT_EQ(all->size(), 2u);
  EXPECT_EQ(fakes.countLogged("Rebuilding container class cache: 501-Data/Application"), 1u);
}

TEST_F(ContainerCacheTest, LookupFindsTheRecordItHoldsAndSaysWhyWhenItCannot) {
  auto made = writeContainer(501, 2, "com.example.app");
  writeContainer(501, 2, "com.example.kept");
  writeContainer(501, 9, "com.example.service", true);
  KSTErrorRef error;
  auto found = cache().containerForUser(501, 2, "com.example.app", false, &error);
  ASSERT_NE(found, nullptr) << messageOf(error);
  EXPECT_EQ(found->url(), made->url());
  EXPECT_EQ(found->uuid(), made->uuid());
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.app", false, &error), found);
  EXPECT_TRUE(
      fakes.logging->containsMessage("Cache: Data/Application: Found Identifier: com.example.app"));
  auto service = cache().containerForUser(501, 9, "com.example.service", true, &error);
  ASSERT_NE(service, nullptr) << messageOf(error);
  EXPECT_TRUE(service->transient());
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Rebuilding container class cache: 501-Data/VexelService(transient)"));

  // User, class, identifier, transient; the code, message and message beneath of the error.
  // Only a container that is not found goes unlogged.
  const std::tuple<std::uint32_t, KSTContainerClass, std::optional<std::string_view>, bool,
                   std::int64_t, std::string, std::string>
      rows[] = {
          {501, 2, "com.example.missing", false, 21,
           "Cache: Data/Application: Container Not Found with ID: com.example.missing", ""},
          {501, 9, "com.example.service", false, 21,
           "Cache: Data/VexelService: Container Not Found with ID: com.example.service", ""},
          {501, 2, "com.example.app", true, 21,
           "Cache: Data/Application(transient): Container Not Found with ID: com.example.app", ""},
          {501, 0, "com.example.app", false, 47, "Invalid Content Class: 0", ""},
          {501, 14, "com.example.app", false, 47, "Invalid Content Class: 14", ""},
          {501, 2, std::nullopt, false, 47, "Invalid identifier: (null)", ""},
          {501, 13, "group.example", false, 43, "Cache: 501-Shared/SystemGroup: Failed to rebuild",
           "Invalid cache get-userId 501 for class 13"},
          {503, 2, "com.example.app", false, 43, "Cache: 503-Data/Application: Failed to rebuild",
           "No class directory for 503-Data/Application"},
      };
  for (const auto& [user, containerClass, identifier, transient, code, message, beneath] : rows) {
    SCOPED_TRACE(message);
    fakes.logging->clear();
    error = nullptr;
    EXPECT_EQ(cache().containerForUser(user, containerClass, identifier, transient, &error),
              nullptr);
    ASSERT_TRUE(isError(error, code, message));
    EXPECT_EQ(messageOf(error->underlyingError()), beneath);
    EXPECT_EQ(fakes.logged(message), code != 21);
  }

  // Metadata removed behind the cache's back: inconsistent, and skipped by listings
  // until it comes back; the entry stays.
  const std::string metadataPath = KSTMetadata::metadataFileURL(made->url()).path();
  fs::remove(metadataPath);
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.app", false, &error), nullptr);
  EXPECT_TRUE(
      isError(error, 44, "Cache: Data/Application: INCONSISTENT-No Metadata at: " + metadataPath));
  auto all = cache().allContainersForUser(501, 2, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ(all->front()->identifier(), "com.example.kept");
  EXPECT_EQ(identifiers(501, 2), (Strings{"com.example.app", "com.example.kept"}));
  ASSERT_TRUE(made->writeMetadataToDiskWithError(nullptr));
  EXPECT_NE(cache().containerForUser(501, 2, "com.example.app", false, &error), nullptr);
}

TEST_F(ContainerCacheTest, AddAndRemoveChangeOnlyTheirClassMap) {
  EXPECT_TRUE(identifiers(501, 2).empty());
  auto record = writeContainer(501, 2, "com.example.new");
  // Built in staging, renamed into place, then added with its final URL.
  const KSTFileURL finalURL(classDirectory(501, 2) + "/FINAL", true);
  fs::rename(record->url().path(), finalURL.path());
  KSTErrorRef error;
  ASSERT_TRUE(cache().addContainerMetadata(record, 501, finalURL, false, &error))
      << messageOf(error);
  EXPECT_EQ(record->url(), finalURL);
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), record);
  EXPECT_TRUE(identifiers(501, 2, true).empty());
  EXPECT_TRUE(identifiers(502, 2).empty());
  // A second record under the same identifier replaces the first.
  auto replacement = writeContainer(501, 2, "com.example.new");
  ASSERT_TRUE(cache().addContainerMetadata(replacement, 501, replacement->url(), false, &error));
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), replacement);

  ASSERT_TRUE(cache().removeContainerForUser(501, 2, "com.example.new", false, &error));
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), nullptr);
  EXPECT_TRUE(isError(error, 21));
  EXPECT_TRUE(cache().removeContainerForUser(501, 2, "com.example.never", false, &error));
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Cache: Data/Application: Removed Identifier: com.example.never"));

  auto made = [](std::uint32_t user, KSTContainerClass containerClass) {
    return KSTMetadata::initWithUserId(user, platform::Uuid::random(), containerClass, "com.x",
                                       std::nullopt, KSTFileURL());
  };
  using Add = std::tuple<KSTMetadataRef, KSTFileURL, std::int64_t, std::string>;
  for (const auto& [added, url, code, message] :
       {Add{nullptr, finalURL, 47, "Invalid Metadata Content Class: 0"},
        Add{made(501, 14), finalURL, 47, "Invalid Metadata Content Class: 14"},
        Add{record, KSTFileURL(), 47, "Invalid input: URL: (null)"},
        Add{made(33, 1), finalURL, 43, "Cache: 501-Bundle/Application: Failed to rebuild"}}) {
    EXPECT_FALSE(cache().addContainerMetadata(added, 501, url, false, &error)) << message;
    EXPECT_TRUE(isError(error, code, message));
  }
  using Remove = std::tuple<std::uint32_t, KSTContainerClass, std::optional<std::string>,
                            std::int64_t, std::string>;
  for (const auto& [user, containerClass, id, code, message] :
       {Remove{501, 2, std::nullopt, 47, "Invalid Identifier: (null)"},
        Remove{501, 0, "com.x", 47, "Invalid Content Class: 0"},
        Remove{499, 2, "com.x", 43, "Cache: 499-Data/Application: Failed to rebuild"}}) {
    EXPECT_FALSE(cache().removeContainerForUser(user, containerClass, id, false, &error))
        << message;
    EXPECT_TRUE(isError(error, code, message));
  }
  EXPECT_EQ(record->url(), finalURL);  // A refused add changes nothing.
  EXPECT_FALSE(cache().allContainersForUser(501, 99, false, &error));
  EXPECT_TRUE(isError(error, 47, "Invalid Content Class: 99"));
  EXPECT_FALSE(cache().allContainerIdentifiersForUser(33, 13, false, &error));
  EXPECT_TRUE(isError(error, 43));
}

TEST_F(ContainerCacheTest, LookupByUuidPrefersTheLiveContainer) {
  const platform::Uuid uuid = platform::Uuid::random();
  auto live = writeContainer(501, 7, "group.example", false, uuid);
  auto transient = writeContainer(501, 7, "group.example", true, uuid);
  auto other = writeContainer(501, 7, "group.other", false);
  auto found = cache().containerForUser(501, 7, "group.example", uuid.string());
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->url(), live->url());
  EXPECT_FALSE(found->transient());
  // Any case of the text names the same UUID.
  std::string lower = uuid.string();
  std::transform(lower.begin(), lower.end(), lower.begin(), ::tolower);
  EXPECT_NE(cache().containerForUser(501, 7, "group.example", lower), nullptr);

  ASSERT_TRUE(cache().removeContainerForUser(501, 7, "group.example", false, nullptr));
  found = cache().containerForUser(501, 7, "group.example", uuid.string());
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->url(), transient->url());
  EXPECT_TRUE(found->transient());
  EXPECT_EQ(cache().containerForUser(501, 7, "group.other", uuid.string()), nullptr);
  EXPECT_EQ(cache().containerForUser(501, 7, "group.example", "not-a-uuid"), nullptr);
  EXPECT_EQ(cache().containerForUser(501, 7, std::nullopt, uuid.string()), nullptr);
  EXPECT_NE(cache().containerForUser(501, 7, "group.other", other->uuid().string()), nullptr);
}

// The account database, failing for uid 777 while the cache is rebuilding.
struct ThrowingAccounts final : platform::Accounts {
  explicit ThrowingAccounts(std::shared_ptr<platform::Accounts> inner) : inner(std::move(inner)) {}
  std::optional<platform::UserAccount> userById(uid_t uid) const override {
    if (uid == 777) throw std::runtime_error("account database unreachable");
    return inner->userById(uid);
  }
  std::optional<platform::UserAccount> userByName(std::string_view name) const override {
    return inner->userByName(name);
  }
  std::optional<platform::GroupAccount> groupByName(std::string_view name) const override {
    return inner->groupByName(name);
  }
  std::optional<platform::GroupAccount> groupById(gid_t gid) const override {
    return inner->groupById(gid);
  }
  std::shared_ptr<platform::Accounts> inner;
};

TEST_F(ContainerCacheTest, ExceptionBecomesError40AndReleasesTheLock) {
  fakes.services.accounts = std::make_shared<ThrowingAccounts>(fakes.accounts);
  fakes.install();
  writeContainer(501, 2, "com.example.app");
  KSTErrorRef error;
  EXPECT_EQ(cache().containerForUser(777, 2, "com.example.app", false, &error), nullptr);
  EXPECT_TRUE(isError(error, 40));
  EXPECT_TRUE(messageOf(error).starts_with("Got exception: account database unreachable : "))
      << messageOf(error);
  EXPECT_TRUE(fakes.logged("Got exception: account database unreachable : "));
  EXPECT_FALSE(cache().removeContainerForUser(777, 2, "com.example.app", false, &error));
  EXPECT_TRUE(isError(error, 40));
  // Both locks were let go on the way out.
  EXPECT_NE(cache().containerForUser(501, 2, "com.example.app", false, &error), nullptr);
}

using ContainerCacheConcurrencyTest = ContainerCacheTest;

TEST_F(ContainerCacheConcurrencyTest, ManyThreadsLookUpAddAndRemoveTogether) {
  constexpr int kThreads = 8, kRounds = 25;
  const std::uint32_t users[] = {501, 502};
  for (std::uint32_t user : users) {
    for (int i = 0; i < 4; ++i) writeContainer(user, 2, "com.example.shared" + std::to_string(i));
  }
  // Each thread's own containers exist on disk before they are added.
  std::vector<std::vector<KSTMetadataRef>> own(kThreads);
  for (int t = 0; t < kThreads; ++t) {
    for (int i = 0; i < kRounds; ++i) {
      const std::string id = "com.example.t" + std::to_string(t) + "." + std::to_string(i);
      own[t].push_back(writeContainer(users[t % 2], 2, id, (i % 2) == 1));
    }
  }
  // Nothing is cached yet: the first users of each map race to build it.
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      const std::uint32_t user = users[t % 2];
      for (int i = 0; i < kRounds; ++i) {
        KSTErrorRef error;
        const auto& mine = own[t][i];
        const std::string shared = "com.example.shared" + std::to_string(i % 4);
        bool ok = cache().addContainerMetadata(mine, user, mine->url(), mine->transient(), &error);
        auto found = cache().containerForUser(user, 2, shared, false, &error);
        ok &= found != nullptr && found->uid() == user;
        ok &= cache().containerForUser(user, 2, mine->identifier(), mine->uuid().string()) == mine;
        ok &= cache().allContainersForUser(user, 2, (i % 2) == 1, &error).has_value();
        if (i % 3 == 0) {
          ok &= cache().removeContainerForUser(user, 2, mine->identifier(), mine->transient(),
                                               &error);
        }
        if (!ok) ++failures;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);

  // Every map was built once, and holds what was added and not removed.
  std::size_t cached = 0;
  for (std::uint32_t user : users) {
    for (bool transient : {false, true}) {
      const std::string key =
          std::to_string(user) + "-Data/Application" + (transient ? "(transient)" : "");
      EXPECT_EQ(fakes.countLogged("Rebuilding container class cache: " + key), 1u) << key;
      cached += identifiers(user, 2, transient).size();
    }
  }
  const std::size_t kept = kThreads * (kRounds - (kRounds + 2) / 3);  // rounds with i % 3 != 0
  EXPECT_EQ(cached, kept + 4 * std::size(users));
}

}  // namespace
}  // namespace kestrel
