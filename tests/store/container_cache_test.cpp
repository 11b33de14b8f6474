#include "store/container_cache.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <functional>
#include <stdexcept>
#include <thread>

#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

std::string messageOf(const KSTErrorRef& error) {
  return error ? error->localizedDescription().value_or("") : "";
}

class ContainerCacheTest : public ::testing::Test {
 protected:
  KSTContainerCache& cache() { return KSTContainerCache::sharedInstance(); }

  KSTFileURL classDirectory(std::uint32_t user, KSTContainerClass containerClass,
                            bool transient = false) {
    auto url = KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        user, containerClass, transient);
    EXPECT_TRUE(url.has_value());
    return url.value_or(KSTFileURL());
  }

  // A container on disk: a directory named by a fresh UUID with its metadata.
  KSTMetadataRef makeContainer(std::uint32_t user, KSTContainerClass containerClass,
                               const std::string& identifier, bool transient = false,
                               std::optional<platform::Uuid> uuid = std::nullopt) {
    const KSTFileURL url = classDirectory(user, containerClass, transient)
                               .appending(platform::Uuid::random().string(), true);
    fs::create_directories(url.path());
    auto record = KSTMetadata::initWithUserId(user, uuid.value_or(platform::Uuid::random()),
                                              containerClass, identifier, std::nullopt, url);
    record->setTransient(transient);
    KSTErrorRef error;
    EXPECT_TRUE(record->writeMetadataToDiskWithError(&error)) << FormatArg(error).description();
    return record;
  }

  std::vector<std::string> identifiers(std::uint32_t user, KSTContainerClass containerClass,
                                       bool transient = false) {
    KSTErrorRef error;
    auto ids = cache().allContainerIdentifiersForUser(user, containerClass, transient, &error);
    EXPECT_TRUE(ids.has_value()) << FormatArg(error).description();
    std::vector<std::string> sorted = ids.value_or(std::vector<std::string>{});
    std::sort(sorted.begin(), sorted.end());
    return sorted;
  }

  testing::FakeServices fakes;
};

TEST_F(ContainerCacheTest, RebuildFromAJunkFilledDirectoryKeepsOnlyValidContainers) {
  makeContainer(501, 2, "com.example.a");
  makeContainer(501, 2, "com.example.b");
  const std::string dir = classDirectory(501, 2).path();

  // Junk beside them.
  ASSERT_EQ(::mkfifo((dir + "/fifo").c_str(), 0644), 0);
  fs::create_directory(dir + "/no-metadata");
  fs::create_directory(dir + "/unreadable");
  ::chmod((dir + "/unreadable").c_str(), 0);
  // Valid metadata of another user, of another class, and hidden.
  auto other = makeContainer(502, 2, "com.example.other-user");
  fs::rename(other->url().path(), dir + "/other-user");
  auto plugin = makeContainer(501, 4, "com.example.plugin");
  fs::rename(plugin->url().path(), dir + "/other-class");
  auto hidden = makeContainer(501, 2, "com.example.hidden");
  fs::rename(hidden->url().path(), dir + "/.hidden");
  // A link to a valid container elsewhere is not followed.
  auto outside = makeContainer(501, 2, "com.example.linked");
  const std::string elsewhere = fakes.scratch.resolve("/private/var/elsewhere");
  fs::create_directories(elsewhere);
  fs::rename(outside->url().path(), elsewhere + "/LINKED");
  fs::create_directory_symlink(elsewhere + "/LINKED", dir + "/link");
  fs::create_symlink("/nonexistent", dir + "/dangling");

  EXPECT_EQ(identifiers(501, 2), (std::vector<std::string>{"com.example.a", "com.example.b"}));
  auto all = cache().allContainersForUser(501, 2, false, nullptr);
  ASSERT_TRUE(all);
  EXPECT_EQ(all->size(), 2u);
  EXPECT_EQ(fakes.countLogged("Rebuilding container class cache: 501-Data/Application"), 1u);
}

TEST_F(ContainerCacheTest, LookupFindsTheRecordItHoldsAndSaysWhyWhenItCannot) {
  auto made = makeContainer(501, 2, "com.example.app");
  auto transient = makeContainer(501, 9, "com.example.service", true);

  KSTErrorRef error;
  auto found = cache().containerForUser(501, 2, "com.example.app", false, &error);
  ASSERT_NE(found, nullptr) << FormatArg(error).description();
  EXPECT_EQ(found->url(), made->url());
  EXPECT_EQ(found->uuid(), made->uuid());
  // The cached object itself.
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.app", false, &error), found);
  EXPECT_TRUE(
      fakes.logging->containsMessage("Cache: Data/Application: Found Identifier: com.example.app"));

  auto service = cache().containerForUser(501, 9, "com.example.service", true, &error);
  ASSERT_NE(service, nullptr) << FormatArg(error).description();
  EXPECT_TRUE(service->transient());
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Rebuilding container class cache: 501-Data/VexelService(transient)"));

  struct Row {
    const char* label;
    std::uint32_t user;
    KSTContainerClass containerClass;
    std::optional<std::string_view> identifier;
    bool transient;
    std::int64_t code;
    std::string message;
    std::string underlying;  // Message of the error beneath, if any.
    bool logged;
  };
  const Row rows[] = {
      {"not cached", 501, 2, "com.example.missing", false, 21,
       "Cache: Data/Application: Container Not Found with ID: com.example.missing", "", false},
      {"live only", 501, 9, "com.example.service", false, 21,
       "Cache: Data/VexelService: Container Not Found with ID: com.example.service", "", false},
      {"transient only", 501, 2, "com.example.app", true, 21,
       "Cache: Data/Application(transient): Container Not Found with ID: com.example.app", "",
       false},
      {"class 0", 501, 0, "com.example.app", false, 47, "Invalid Content Class: 0", "", true},
      {"class 14", 501, 14, "com.example.app", false, 47, "Invalid Content Class: 14", "", true},
      {"no identifier", 501, 2, std::nullopt, false, 47, "Invalid identifier: (null)", "", true},
      {"system group for a mobile user", 501, 13, "group.example", false, 43,
       "Cache: 501-Shared/SystemGroup: Failed to rebuild",
       "Invalid cache get-userId 501 for class 13", true},
      {"user without an account", 503, 2, "com.example.app", false, 43,
       "Cache: 503-Data/Application: Failed to rebuild",
       "No class directory for 503-Data/Application", true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    fakes.logging->clear();
    error = nullptr;
    EXPECT_EQ(cache().containerForUser(row.user, row.containerClass, row.identifier, row.transient,
                                       &error),
              nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->code(), row.code);
    EXPECT_EQ(messageOf(error), row.message);
    EXPECT_EQ(messageOf(error->underlyingError()), row.underlying);
    EXPECT_EQ(fakes.logged(row.message), row.logged);
  }
}

TEST_F(ContainerCacheTest, MetadataRemovedBehindTheCachesBackIsInconsistent) {
  auto kept = makeContainer(501, 2, "com.example.kept");
  auto gone = makeContainer(501, 2, "com.example.gone");
  EXPECT_EQ(identifiers(501, 2).size(), 2u);
  const std::string metadataPath = KSTMetadata::metadataFileURL(gone->url()).path();
  fs::remove(metadataPath);

  KSTErrorRef error;
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.gone", false, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), 44);
  EXPECT_EQ(messageOf(error),
            "Cache: Data/Application: INCONSISTENT-No Metadata at: " + metadataPath);

  auto all = cache().allContainersForUser(501, 2, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ(all->front()->identifier(), "com.example.kept");
  // The entry stays until it is removed.
  EXPECT_EQ(identifiers(501, 2),
            (std::vector<std::string>{"com.example.gone", "com.example.kept"}));

  // The file comes back: so does the container.
  ASSERT_TRUE(gone->writeMetadataToDiskWithError(nullptr));
  EXPECT_NE(cache().containerForUser(501, 2, "com.example.gone", false, &error), nullptr);
}

TEST_F(ContainerCacheTest, AddAndRemoveChangeOnlyTheirClassMap) {
  EXPECT_TRUE(identifiers(501, 2).empty());
  auto record = makeContainer(501, 2, "com.example.new");
  // Built in staging, renamed into place, then added with its final URL.
  const KSTFileURL finalURL = classDirectory(501, 2).appending("FINAL", true);
  fs::rename(record->url().path(), finalURL.path());

  KSTErrorRef error;
  ASSERT_TRUE(cache().addContainerMetadata(record, 501, finalURL, false, &error))
      << FormatArg(error).description();
  EXPECT_EQ(record->url(), finalURL);
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), record);
  EXPECT_TRUE(identifiers(501, 2, true).empty());
  EXPECT_TRUE(identifiers(502, 2).empty());

  // A second record under the same identifier replaces the first.
  auto replacement = makeContainer(501, 2, "com.example.new");
  ASSERT_TRUE(cache().addContainerMetadata(replacement, 501, replacement->url(), false, &error));
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), replacement);

  ASSERT_TRUE(cache().removeContainerForUser(501, 2, "com.example.new", false, &error));
  EXPECT_EQ(cache().containerForUser(501, 2, "com.example.new", false, &error), nullptr);
  EXPECT_EQ(error->code(), 21);
  EXPECT_TRUE(cache().removeContainerForUser(501, 2, "com.example.never", false, &error));
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Cache: Data/Application: Removed Identifier: com.example.never"));

  struct Row {
    const char* label;
    std::function<bool(KSTErrorRef*)> call;
    std::int64_t code;
    std::string message;
  };
  auto bundle = KSTMetadata::initWithUserId(33, platform::Uuid::random(), 1, "com.example.bundle",
                                            std::nullopt, KSTFileURL());
  auto outOfRange = KSTMetadata::initWithUserId(501, platform::Uuid::random(), 14, "com.x",
                                                std::nullopt, KSTFileURL());
  const Row rows[] = {
      {"no record",
       [&](KSTErrorRef* e) {
         return cache().addContainerMetadata(nullptr, 501, finalURL, false, e);
       },
       47, "Invalid Metadata Content Class: 0"},
      {"class 14",
       [&](KSTErrorRef* e) {
         return cache().addContainerMetadata(outOfRange, 501, finalURL, false, e);
       },
       47, "Invalid Metadata Content Class: 14"},
      {"no URL",
       [&](KSTErrorRef* e) {
         return cache().addContainerMetadata(record, 501, KSTFileURL(), false, e);
       },
       47, "Invalid input: URL: (null)"},
      {"bundle for a mobile user",
       [&](KSTErrorRef* e) {
         return cache().addContainerMetadata(bundle, 501, finalURL, false, e);
       },
       43, "Cache: 501-Bundle/Application: Failed to rebuild"},
      {"remove without identifier",
       [&](KSTErrorRef* e) {
         return cache().removeContainerForUser(501, 2, std::nullopt, false, e);
       },
       47, "Invalid Identifier: (null)"},
      {"remove of class 0",
       [&](KSTErrorRef* e) { return cache().removeContainerForUser(501, 0, "com.x", false, e); },
       47, "Invalid Content Class: 0"},
      {"remove for the system user",
       [&](KSTErrorRef* e) { return cache().removeContainerForUser(499, 2, "com.x", false, e); },
       43, "Cache: 499-Data/Application: Failed to rebuild"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    KSTErrorRef rowError;
    EXPECT_FALSE(row.call(&rowError));
    ASSERT_NE(rowError, nullptr);
    EXPECT_EQ(rowError->code(), row.code);
    EXPECT_EQ(messageOf(rowError), row.message);
  }
  EXPECT_EQ(record->url(), finalURL);  // A refused add changes nothing.

  // Listing errors name their class check too.
  EXPECT_FALSE(cache().allContainersForUser(501, 99, false, &error));
  EXPECT_EQ(messageOf(error), "Invalid Content Class: 99");
  EXPECT_FALSE(cache().allContainerIdentifiersForUser(33, 13, false, &error));
  EXPECT_EQ(error->code(), 43);
}

TEST_F(ContainerCacheTest, LookupByUuidPrefersTheLiveContainer) {
  const platform::Uuid uuid = platform::Uuid::random();
  auto live = makeContainer(501, 7, "group.example", false, uuid);
  auto transient = makeContainer(501, 7, "group.example", true, uuid);
  auto otherUuid = makeContainer(501, 7, "group.other", false);

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
  EXPECT_NE(cache().containerForUser(501, 7, "group.other", otherUuid->uuid().string()), nullptr);
}

// The account database that fails while the cache is rebuilding.
class ThrowingAccounts final : public platform::Accounts {
 public:
  explicit ThrowingAccounts(std::shared_ptr<platform::Accounts> inner) : inner_(std::move(inner)) {}
  std::optional<platform::UserAccount> userByName(std::string_view name) const override {
    return inner_->userByName(name);
  }
  std::optional<platform::UserAccount> userById(uid_t uid) const override {
    if (uid == 777) throw std::runtime_error("account database unreachable");
    return inner_->userById(uid);
  }
  std::optional<platform::GroupAccount> groupByName(std::string_view name) const override {
    return inner_->groupByName(name);
  }
  std::optional<platform::GroupAccount> groupById(gid_t gid) const override {
    return inner_->groupById(gid);
  }

 private:
  std::shared_ptr<platform::Accounts> inner_;
};

TEST_F(ContainerCacheTest, ExceptionBecomesError40AndReleasesTheLock) {
  fakes.services.accounts = std::make_shared<ThrowingAccounts>(fakes.accounts);
  fakes.install();
  makeContainer(501, 2, "com.example.app");

  KSTErrorRef error;
  EXPECT_EQ(cache().containerForUser(777, 2, "com.example.app", false, &error), nullptr);
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), 40);
  EXPECT_EQ(messageOf(error).rfind("Got exception: account database unreachable : ", 0), 0u)
      << messageOf(error);
  EXPECT_TRUE(fakes.logged("Got exception: account database unreachable : "));

  EXPECT_FALSE(cache().removeContainerForUser(777, 2, "com.example.app", false, &error));
  EXPECT_EQ(error->code(), 40);
  // Both locks were let go on the way out.
  EXPECT_NE(cache().containerForUser(501, 2, "com.example.app", false, &error), nullptr);
}

class ContainerCacheConcurrencyTest : public ContainerCacheTest {};

TEST_F(ContainerCacheConcurrencyTest, ManyThreadsLookUpAddAndRemoveTogether) {
  constexpr int kThreads = 8;
  constexpr int kRounds = 25;
  const std::vector<std::uint32_t> users{501, 502};
  for (std::uint32_t user : users) {
    for (int i = 0; i < 4; ++i) makeContainer(user, 2, "com.example.shared" + std::to_string(i));
  }
  // Each thread's own containers exist on disk before they are added.
  std::vector<std::vector<KSTMetadataRef>> own(kThreads);
  for (int t = 0; t < kThreads; ++t) {
    for (int i = 0; i < kRounds; ++i) {
      own[t].push_back(makeContainer(users[t % 2], 2,
                                     "com.example.t" + std::to_string(t) + "." + std::to_string(i),
                                     (i % 2) == 1));
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
        if (!cache().addContainerMetadata(mine, user, mine->url(), mine->transient(), &error)) {
          ++failures;
        }
        const std::string shared = "com.example.shared" + std::to_string(i % 4);
        auto found = cache().containerForUser(user, 2, shared, false, &error);
        if (found == nullptr || found->uid() != user) ++failures;
        if (cache().containerForUser(user, 2, mine->identifier(), mine->uuid().string()) != mine) {
          ++failures;
        }
        auto all = cache().allContainersForUser(user, 2, (i % 2) == 1, &error);
        if (!all) ++failures;
        if (i % 3 == 0 && !cache().removeContainerForUser(user, 2, mine->identifier(),
                                                          mine->transient(), &error)) {
          ++failures;
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);

  // Every map was built once, and holds what was added and not removed.
  for (std::uint32_t user : users) {
    for (bool transient : {false, true}) {
      const std::string key =
          std::to_string(user) + "-Data/Application" + (transient ? "(transient)" : "");
      EXPECT_EQ(fakes.countLogged("Rebuilding container class cache: " + key), 1u) << key;
    }
  }
  std::size_t expected = 0;
  for (int t = 0; t < kThreads; ++t) {
    for (int i = 0; i < kRounds; ++i) expected += (i % 3) != 0;
  }
  std::size_t cached = 0;
  for (std::uint32_t user : users) {
    cached += identifiers(user, 2, false).size() + identifiers(user, 2, true).size();
  }
  EXPECT_EQ(cached, expected + 4 * users.size());
}

}  // namespace
}  // namespace kestrel
