// Stage-for-delete and delete-one: where a staged container ends up, what
// stops pointing at it, and which entries of a batch are skipped or end it.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "daemon/error_codes.h"
#include "store/container_cache.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::storedEntry;
using Identifiers = std::optional<std::vector<std::optional<std::string>>>;
using Classes = std::vector<std::optional<KSTContainerClass>>;
using Strings = std::vector<std::string>;

constexpr std::uint64_t kSandboxItemTypeData = 1;
constexpr const char* kStageTag = "stageForDeleteContainersWithUsers";

class ContainerDeletionTest : public testing::StoreTest {
 protected:
  static bool cached(const KSTMetadataRef& container) {
    return KSTContainerCache::sharedInstance().containerForUser(
               container->uid(), container->containerClass(), container->identifier(),
               container->uuid().string()) != nullptr;
  }
  static fs::path deathRow() { return testing::deathRowDirectory(); }
  // Staged directly: under its own directory name, not inside a holder.
  static bool staged(const KSTMetadataRef& container) {
    const fs::path place = container->url().path();
    return !fs::exists(place) && fs::is_directory(deathRow() / place.filename());
  }
  std::uint64_t stage(const std::vector<KSTMetadataRef>& containers) {
    std::vector<std::uint32_t> users;
    std::vector<std::optional<platform::Uuid>> uuids;
    Identifiers identifiers(std::in_place);
    Classes classes;
    for (const KSTMetadataRef& container : containers) {
      users.push_back(container->uid());
      uuids.emplace_back(container->uuid());
      identifiers->emplace_back(container->identifier());
      classes.emplace_back(container->containerClass());
    }
    std::uint64_t code = kKSTSuccess;
    installer.stageForDeleteContainersWithUsers(users, uuids, identifiers, classes, true, &code);
    return code;
  }
  // The lines of the tag, without the source line that leads each one.
  Strings linesFrom(std::string_view tag) const {
    Strings messages;
    for (const auto& line : fakes.logging->lines()) {
      const std::size_t start = line.message.find(": ");
      if (line.tag == tag) {
        messages.push_back(start == std::string::npos ? line.message
                                                      : line.message.substr(start + 2));
      }
    }
    return messages;
  }
  bool loggedFrom(std::string_view tag, std::string_view prefix) const {
    const Strings lines = linesFrom(tag);
    return std::any_of(lines.begin(), lines.end(),
                       [&](const std::string& line) { return line.starts_with(prefix); });
  }
};

TEST_F(ContainerDeletionTest, BatchSkipsBadAndMissingEntriesAndStagesTheRealOnes) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  const KSTMetadataRef bundle = make(33, 1, "com.example.app");
  ASSERT_TRUE(app && bundle);
  ASSERT_TRUE(installer._setSandboxContainerMappingForUser(501, "com.example.app", 2, app->url()));
  // A bundle takes the code-signing entries of its identifier and children along.
  KSTCodeSigningEntry parent(PlistDictionary{}, 2);
  parent.setChildBundleIdentifiers(Strings{"com.example.app.ext"});
  ASSERT_EQ(testing::storeEntries(KSTCodeSigningMapping::sharedInstance(),
                                  {parent, KSTCodeSigningEntry(PlistDictionary{}, 4)},
                                  {"com.example.app", "com.example.app.ext"}),
            nullptr);
  fakes.sandbox->clearCalls();

  const std::string id = "com.example.app";
  std::uint64_t code = kKSTSuccess;
  installer.stageForDeleteContainersWithUsers(
      {501, 502, 503, 504, 501, 501},
      {app->uuid(), std::nullopt, app->uuid(), app->uuid(), platform::Uuid::random(), app->uuid()},
      Identifiers{{id, id, std::nullopt, id, id, id}}, {std::nullopt, 2, 2, 14, 2, 2}, true, &code);
  EXPECT_EQ(code, kKSTSuccess);
  EXPECT_TRUE(staged(app));
  EXPECT_FALSE(cached(app));
  EXPECT_FALSE(fakes.sandbox->userStateItem(501, kSandboxItemTypeData, id));
  ASSERT_EQ(fakes.sandbox->calls().size(), 1u);  // only the real entry reached the sandbox
  EXPECT_TRUE(fakes.sandbox->calls()[0].isRemoval());
  // A data container leaves the entries alone.
  EXPECT_TRUE(storedEntry("com.example.app") && storedEntry("com.example.app.ext"));
  EXPECT_EQ(stage({bundle}), kKSTSuccess);
  EXPECT_TRUE(staged(bundle));
  EXPECT_FALSE(storedEntry("com.example.app"));
  EXPECT_FALSE(storedEntry("com.example.app.ext"));

  // One line for each bad entry; the entry of no container passes silently.
  const std::string invalid = "Can't act on an invalid object: ";
  const std::string uuid = app->uuid().string();
  EXPECT_EQ(linesFrom(kStageTag),
            (Strings{invalid + "class: (null)",
                     invalid + "userId: 502, UUID: (null), ID: com.example.app, Class: 2",
                     invalid + "userId: 503, UUID: " + uuid + ", ID: (null), Class: 2",
                     invalid + "userId: 504, UUID: " + uuid + ", ID: com.example.app, Class: 14"}));
  // Staging what is already staged finds nothing and is no failure.
  EXPECT_EQ(stage({app}), kKSTSuccess);
}

TEST_F(ContainerDeletionTest, MismatchedCountsFailBeforeAnythingMoves) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  const Identifiers one{{app->identifier()}};
  const std::tuple<std::vector<std::uint32_t>, Identifiers, Classes, const char*> rows[] = {
      {{501}, one, {}, "UUIDString count: 1, class count: 0, ID count: 1"},
      {{501}, Identifiers{{"a", "b"}}, {2}, "UUIDString count: 1, class count: 1, ID count: 2"},
      {{}, one, {2}, "UUIDString count: 1, user count: 0"},
  };
  for (const auto& [users, identifiers, classes, message] : rows) {
    SCOPED_TRACE(message);
    std::uint64_t code = kKSTSuccess;
    installer.stageForDeleteContainersWithUsers(users, {app->uuid()}, identifiers, classes, true,
                                                &code);
    EXPECT_EQ(code, kKSTErrorInvalidObject);
    EXPECT_TRUE(loggedFrom(kStageTag, std::string("Can't act on an invalid input: ") + message));
    EXPECT_TRUE(cached(app));
  }
  // An empty batch without an identifiers array is no failure.
  std::uint64_t code = kKSTSuccess;
  installer.stageForDeleteContainersWithUsers({}, {}, std::nullopt, {}, true, &code);
  EXPECT_EQ(code, kKSTSuccess);
}

TEST_F(ContainerDeletionTest, AFailedCacheRemovalEndsTheBatch) {
  auto sandbox = std::make_shared<testing::HookedSandbox>();
  useSandbox(sandbox);
  const KSTMetadataRef plugin = make(501, 4, "com.example.plugin");
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  const KSTMetadataRef group = make(501, 7, "group.com.example");
  ASSERT_TRUE(plugin && app && group);
  // Just before the app's cache entry goes, its class map has to be rebuilt
  // from a class directory that cannot be listed.
  sandbox->identifier = "com.example.app";
  sandbox->hook = [&] { testing::breakClassDirectory(app); };

  EXPECT_EQ(stage({plugin, app, group}), kKSTErrorCacheRemoveFailed);
  EXPECT_TRUE(loggedFrom(
      kStageTag, "Failed to remove from cache id: com.example.app, class: 2, transient: 0 ("));
  EXPECT_TRUE(staged(plugin));
  EXPECT_FALSE(cached(plugin));
  EXPECT_TRUE(fs::is_directory(deathRow() / fs::path(app->url().path()).filename()));
  // The group after it was never reached.
  EXPECT_TRUE(fs::is_directory(group->url().path()));
  EXPECT_TRUE(cached(group));
  EXPECT_EQ(sandbox->removals, (Strings{"com.example.plugin", "com.example.app"}));
}

TEST_F(ContainerDeletionTest, DeleteOneFindsTheContainerByIdentifier) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  const KSTMetadataRef temporary = make(501, 2, "com.example.app", /*transient=*/true);
  ASSERT_TRUE(app && temporary);
  // A transient container is retired by the lookup itself, which then finds
  // nothing to hand over.
  const std::tuple<const char*, bool, std::uint64_t> rows[] = {
      {"com.example.none", false, kKSTErrorNotFound},
      {"com.example.app", false, kKSTSuccess},
      {"com.example.app", true, kKSTErrorNotFound},
  };
  for (const auto& [identifier, transient, expected] : rows) {
    SCOPED_TRACE(::testing::Message() << identifier << " transient " << transient);
    std::uint64_t code = kKSTSuccess;
    installer.deleteContainerForUser(501, std::string(identifier), 2, transient, &code);
    EXPECT_EQ(code, expected);
    const std::string failure =
        std::string("Failed to lookup existing container to delete-identifier: ") + identifier +
        ", class: 2, transient: " + (transient ? "1" : "0");
    EXPECT_EQ(fakes.logging->contains("deleteContainerForUser", failure), code != kKSTSuccess);
  }
  EXPECT_TRUE(staged(app));
  EXPECT_FALSE(cached(app));
  EXPECT_FALSE(fs::exists(temporary->url().path()));
  EXPECT_FALSE(cached(temporary));
}

TEST_F(ContainerDeletionTest, CommandsThreeAndTenAnswerThroughTheDispatcher) {
  const KSTMetadataRef first = make(501, 2, "com.example.first");
  const KSTMetadataRef second = make(501, 7, "group.com.example");
  ASSERT_TRUE(first && second);
  connectThroughDispatcher("com.example.client");
  auto stageRequest = testing::request({{"Command", 3u},
                                        {"ContainerClassesArray", PlistArray{2u}},
                                        {"UserIDsArray", PlistArray{1u}},
                                        {"IdentifiersArray", PlistArray{"com.example.first"}}});
  stageRequest.setArray("UUIDsArray", {platform::MessageValue::fromUuid(first->uuid())});
  EXPECT_EQ(ask(stageRequest), kKSTSuccess);
  EXPECT_TRUE(staged(first));
  const auto deleteRequest = testing::request({{"Command", 10u},
                                               {"ContainerClass", 7u},
                                               {"UserID", 501u},
                                               {"Identifier", "group.com.example"}});
  EXPECT_EQ(ask(deleteRequest), kKSTSuccess);
  EXPECT_TRUE(staged(second));
  EXPECT_EQ(ask(deleteRequest), kKSTErrorNotFound);
  EXPECT_FALSE(connection->cancelled());
}

}  // namespace
}  // namespace kestrel
