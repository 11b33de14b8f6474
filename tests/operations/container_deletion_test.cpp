// Stage-for-delete and delete-one: where a staged container ends up, what
// stops pointing at it, and which entries of a batch are skipped or end it.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/request_dispatch.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using Identifiers = std::optional<std::vector<std::optional<std::string>>>;
using Classes = std::vector<std::optional<KSTContainerClass>>;
using Uuids = std::vector<std::optional<platform::Uuid>>;

constexpr std::uint64_t kSandboxItemTypeData = 1;

class ContainerDeletionTest : public ::testing::Test {
 protected:
  KSTMetadataRef create(std::uint32_t user, KSTContainerClass containerClass,
                        const std::string& identifier, bool transient = false) {
    std::uint64_t code = kKSTSuccess;
    KSTMetadataRef made = client.createOrLookupContainerForUser(
        user, identifier, true, containerClass, transient, true, &code);
    EXPECT_TRUE(made) << code;
    return made;
  }
  static bool cached(const KSTMetadataRef& container) {
    return KSTContainerCache::sharedInstance().containerForUser(
               container->uid(), container->containerClass(), container->identifier(),
               container->uuid().string()) != nullptr;
  }
  static fs::path deathRow() {
    return KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  }
  // Staged directly: under its own directory name, not inside a holder.
  static bool staged(const KSTMetadataRef& container) {
    const fs::path place = container->url().path();
    return !fs::exists(place) && fs::is_directory(deathRow() / place.filename());
  }
  std::uint64_t stage(const std::vector<KSTMetadataRef>& containers) {
    std::vector<std::uint32_t> users;
    Uuids uuids;
    Identifiers identifiers(std::in_place);
    Classes classes;
    for (const KSTMetadataRef& container : containers) {
      users.push_back(container->uid());
      uuids.emplace_back(container->uuid());
      identifiers->emplace_back(container->identifier());
      classes.emplace_back(container->containerClass());
    }
    std::uint64_t code = kKSTSuccess;
    client.stageForDeleteContainersWithUsers(users, uuids, identifiers, classes, true, &code);
    return code;
  }
  // The lines of the tag, without the source line that leads each one.
  std::vector<std::string> linesFrom(std::string_view tag) const {
    std::vector<std::string> messages;
    for (const auto& line : fakes.logging->lines()) {
      if (line.tag != tag) continue;
      const std::size_t start = line.message.find(": ");
      messages.push_back(start == std::string::npos ? line.message
                                                    : line.message.substr(start + 2));
    }
    return messages;
  }
  bool loggedFrom(std::string_view tag, std::string_view prefix) const {
    const std::vector<std::string> lines = linesFrom(tag);
    return std::any_of(lines.begin(), lines.end(),
                       [&](const std::string& line) { return line.rfind(prefix, 0) == 0; });
  }

  testing::FakeServices fakes;
  KSTClientConnection client{std::string("com.example.installer"), 0, true, std::nullopt};
};

TEST_F(ContainerDeletionTest, BatchSkipsBadAndMissingEntriesAndStagesTheRealOnes) {
  const KSTMetadataRef app = create(501, 2, "com.example.app");
  const KSTMetadataRef bundle = create(33, 1, "com.example.app");
  ASSERT_TRUE(app && bundle);
  ASSERT_TRUE(client._setSandboxContainerMappingForUser(501, "com.example.app", 2, app->url()));
  // A bundle takes the code-signing entries of its identifier and children along.
  KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
  KSTCodeSigningEntry parent(PlistDictionary{}, 2);
  parent.setChildBundleIdentifiers(std::vector<std::string>{"com.example.app.ext"});
  mapping.withState(true, [&](KSTCodeSigningMappingState& state) {
    return !state._setCodeSigningDictionaryValues(
        {parent, KSTCodeSigningEntry(PlistDictionary{}, 4)},
        {"com.example.app", "com.example.app.ext"});
  });
  auto hasEntry = [&](const char* identifier) {
    return mapping.withState(false, [&](KSTCodeSigningMappingState& state) {
      return state.entryForIdentifier(identifier) != nullptr;
    });
  };
  ASSERT_TRUE(hasEntry("com.example.app") && hasEntry("com.example.app.ext"));
  ASSERT_TRUE(fakes.sandbox->userStateItem(501, kSandboxItemTypeData, "com.example.app"));
  fakes.sandbox->clearCalls();

  const std::string id = "com.example.app";
  std::uint64_t code = kKSTSuccess;
  client.stageForDeleteContainersWithUsers(
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
  EXPECT_TRUE(hasEntry("com.example.app") && hasEntry("com.example.app.ext"));

  EXPECT_EQ(stage({bundle}), kKSTSuccess);
  EXPECT_TRUE(staged(bundle));
  EXPECT_FALSE(hasEntry("com.example.app"));
  EXPECT_FALSE(hasEntry("com.example.app.ext"));

  // One line for each bad entry; the entry of no container passes silently.
  const std::string uuid = app->uuid().string();
  const std::vector<std::string> expected = {
      "Can't act on an invalid object: class: (null)",
      "Can't act on an invalid object: userId: 502, UUID: (null), ID: com.example.app, "
      "Class: 2",
      "Can't act on an invalid object: userId: 503, UUID: " + uuid + ", ID: (null), Class: 2",
      "Can't act on an invalid object: userId: 504, UUID: " + uuid +
          ", ID: com.example.app, Class: 14",
  };
  EXPECT_EQ(linesFrom("stageForDeleteContainersWithUsers"), expected);

  // Staging what is already staged finds nothing and is no failure.
  EXPECT_EQ(stage({app}), kKSTSuccess);
}

TEST_F(ContainerDeletionTest, MismatchedCountsFailBeforeAnythingMoves) {
  const KSTMetadataRef app = create(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  const Identifiers one{{app->identifier()}};
  struct Row {
    const char* label;
    std::vector<std::uint32_t> users;
    Identifiers identifiers;
    Classes classes;
    const char* message;
  } rows[] = {
      {"no classes", {501}, one, {}, "UUIDString count: 1, class count: 0, ID count: 1"},
      {"an identifier too many",
       {501},
       Identifiers{{"a", "b"}},
       {2},
       "UUIDString count: 1, class count: 1, ID count: 2"},
      {"no users", {}, one, {2}, "UUIDString count: 1, user count: 0"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    std::uint64_t code = kKSTSuccess;
    client.stageForDeleteContainersWithUsers(row.users, {app->uuid()}, row.identifiers, row.classes,
                                             true, &code);
    EXPECT_EQ(code, kKSTErrorInvalidObject);
    EXPECT_TRUE(loggedFrom("stageForDeleteContainersWithUsers",
                           std::string("Can't act on an invalid input: ") + row.message));
    EXPECT_TRUE(cached(app));
  }
  // An empty batch without an identifiers array is no failure.
  std::uint64_t code = kKSTSuccess;
  client.stageForDeleteContainersWithUsers({}, {}, std::nullopt, {}, true, &code);
  EXPECT_EQ(code, kKSTSuccess);
}

// Removals of the identifier named run the hook first (once).
class HookedSandbox final : public platform::Sandbox {
 public:
  int setUserStateItem(std::uint32_t, std::uint64_t, const std::string& identifier,
                       const std::optional<std::string>& path, std::uint64_t) override {
    if (!path) removals.push_back(identifier);
    if (!path && identifier == hookIdentifier && hook) std::exchange(hook, nullptr)();
    return 0;
  }
  std::optional<std::string> userStateItem(std::uint32_t, std::uint64_t,
                                           const std::string&) const override {
    return std::nullopt;
  }
  std::vector<platform::SandboxUserStateItem> userStateItems() const override { return {}; }

  std::string hookIdentifier;
  std::function<void()> hook;
  std::vector<std::string> removals;
};

TEST_F(ContainerDeletionTest, AFailedCacheRemovalEndsTheBatch) {
  auto sandbox = std::make_shared<HookedSandbox>();
  fakes.services.sandbox = sandbox;
  fakes.install();
  const KSTMetadataRef plugin = create(501, 4, "com.example.plugin");
  const KSTMetadataRef app = create(501, 2, "com.example.app");
  const KSTMetadataRef group = create(501, 7, "group.com.example");
  ASSERT_TRUE(plugin && app && group);

  // Just before the app's cache entry goes, its class map has to be rebuilt
  // from a class directory that cannot be listed.
  sandbox->hookIdentifier = "com.example.app";
  sandbox->hook = [&] {
    const fs::path classDirectory = fs::path(app->url().path()).parent_path();
    KSTContainerCache::sharedInstance()._discardClassMapForUser(501, 2, false);
    fs::rename(classDirectory, classDirectory.string() + ".aside");
    std::ofstream(classDirectory.string()) << "not a directory";
  };

  EXPECT_EQ(stage({plugin, app, group}), kKSTErrorCacheRemoveFailed);
  EXPECT_TRUE(loggedFrom("stageForDeleteContainersWithUsers",
                         "Failed to remove from cache id: com.example.app, class: 2, "
                         "transient: 0 ("));
  EXPECT_TRUE(staged(plugin));
  EXPECT_FALSE(cached(plugin));
  EXPECT_TRUE(fs::is_directory(deathRow() / fs::path(app->url().path()).filename()));
  // The group after it was never reached.
  EXPECT_TRUE(fs::is_directory(group->url().path()));
  EXPECT_TRUE(cached(group));
  EXPECT_EQ(sandbox->removals, (std::vector<std::string>{"com.example.plugin", "com.example.app"}));
}

TEST_F(ContainerDeletionTest, DeleteOneFindsTheContainerByIdentifier) {
  const KSTMetadataRef app = create(501, 2, "com.example.app");
  const KSTMetadataRef temporary = create(501, 2, "com.example.app", /*transient=*/true);
  ASSERT_TRUE(app && temporary);
  const fs::path temporaryPlace = temporary->url().path();

  struct Row {
    const char* identifier;
    bool transient;
    std::uint64_t code;
  } rows[] = {
      {"com.example.none", false, kKSTErrorNotFound},
      {"com.example.app", false, kKSTSuccess},
      // A transient container is retired by the lookup itself, which then
      // finds nothing to hand over.
      {"com.example.app", true, kKSTErrorNotFound},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::Message() << row.identifier << " transient " << row.transient);
    std::uint64_t code = kKSTSuccess;
    client.deleteContainerForUser(501, std::string(row.identifier), 2, row.transient, &code);
    EXPECT_EQ(code, row.code);
    const std::string failure =
        std::string("Failed to lookup existing container to delete-identifier: ") + row.identifier +
        ", class: 2, transient: " + (row.transient ? "1" : "0");
    EXPECT_EQ(fakes.logging->contains("deleteContainerForUser", failure), code != kKSTSuccess);
  }
  EXPECT_TRUE(staged(app));
  EXPECT_FALSE(cached(app));
  EXPECT_FALSE(fs::exists(temporaryPlace));
  EXPECT_FALSE(cached(temporary));
}

TEST_F(ContainerDeletionTest, CommandsThreeAndTenAnswerThroughTheDispatcher) {
  ASSERT_TRUE(KSTStartRequestListener(platform::DispatchQueue::createConcurrent("test.listener")));
  const KSTMetadataRef first = create(501, 2, "com.example.first");
  const KSTMetadataRef second = create(501, 7, "group.com.example");
  ASSERT_TRUE(first && second);

  auto connection = fakes.connectAllowedClient("com.example.client");

  platform::MessageDictionary stageRequest;
  stageRequest.setUint64("Command", 3);
  stageRequest.setArray("ContainerClassesArray", {platform::MessageValue::fromUint64(2)});
  stageRequest.setArray("UUIDsArray", {platform::MessageValue::fromUuid(first->uuid())});
  stageRequest.setArray("UserIDsArray", {platform::MessageValue::fromUint64(1)});
  ASSERT_TRUE(stageRequest.setPlist("IdentifiersArray", PlistArray{"com.example.first"}));
  ASSERT_TRUE(connection->deliver(stageRequest));
  EXPECT_EQ(connection->lastReply()->uint64("ReplyError"), kKSTSuccess);
  EXPECT_TRUE(staged(first));

  platform::MessageDictionary deleteRequest;
  deleteRequest.setUint64("Command", 10);
  deleteRequest.setUint64("ContainerClass", 7);
  deleteRequest.setUint64("UserID", 501);
  deleteRequest.setString("Identifier", "group.com.example");
  ASSERT_TRUE(connection->deliver(deleteRequest));
  EXPECT_EQ(connection->lastReply()->uint64("ReplyError"), kKSTSuccess);
  EXPECT_TRUE(staged(second));
  ASSERT_TRUE(connection->deliver(deleteRequest));
  EXPECT_EQ(connection->lastReply()->uint64("ReplyError"), kKSTErrorNotFound);
  EXPECT_FALSE(connection->cancelled());
}

}  // namespace
}  // namespace kestrel
