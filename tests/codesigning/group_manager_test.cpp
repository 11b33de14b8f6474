// Group containers: handed out to entitled identifiers, and removed when the
// last entry that names their group lets go of it.
#include "codesigning/group_manager.h"

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <set>
#include <thread>

#include "daemon/client_connection.h"
#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "daemon/locks.h"
#include "store/container_cache.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using Strings = std::vector<std::string>;
constexpr KSTContainerClass kApp = kKSTContainerClassSharedAppGroup;
constexpr KSTContainerClass kSystem = kKSTContainerClassSharedSystemGroup;

class GroupManagerTest : public ::testing::Test {
 protected:
  GroupManagerTest() {
    // 503 is a session without a home directory: never visited.
    fakes.keyBag->setUserTypeInfo(platform::UserTypeInfo{platform::DeviceMode::MultiUser});
    fakes.keyBag->setUserSessionIds({501, 502, 503});
  }

  // Stores (or, without entitlements, removes) an identifier's entry.
  void entitle(const std::string& identifier, std::optional<PlistDictionary> entitlements,
               bool invalid = false) {
    KSTCodeSigningEntry entry;
    if (entitlements)
      entry = KSTCodeSigningEntry(PlistDictionary{{kKSTEntitlementsKey, *entitlements}}, 2);
    entry.setInvalid(invalid);
    onQueue([&](KSTCodeSigningMappingState& state) {
      ASSERT_EQ(state._setCodeSigningDictionaryValues({entry}, {identifier}), nullptr);
    });
  }
  template <typename Fn>
  void onQueue(Fn&& fn) {
    KSTCodeSigningMapping::sharedInstance().withState(true, [&](KSTCodeSigningMappingState& s) {
      fn(s);
      return true;
    });
  }
  // What processing does on the store's queue when an identifier's groups change.
  void change(const KSTGroupIdentifiers& old, const KSTGroupIdentifiers& now, KSTGroupType type) {
    onQueue([&](KSTCodeSigningMappingState& state) {
      KSTGroupManager::defaultManager().handleChangeFromOldGroupContainerIds(old, now, type, state);
    });
  }

  void make(std::uint32_t user, KSTContainerClass containerClass, const std::string& group) {
    std::uint64_t code = kKSTSuccess;
    EXPECT_TRUE(installer.createOrLookupContainerForUser(user, group, true, containerClass, false,
                                                         true, &code))
        << code;
  }
  static KSTMetadataRef find(std::uint32_t user, KSTContainerClass containerClass,
                             const std::string& group) {
    KSTErrorRef error;
    return KSTContainerCache::sharedInstance().containerForUser(user, containerClass, group, false,
                                                                &error);
  }
  static bool exists(std::uint32_t user, KSTContainerClass containerClass,
                     const std::string& group) {
    const KSTMetadataRef found = find(user, containerClass, group);
    return found && std::filesystem::exists(found->url().path());
  }
  testing::FakeServices fakes;
  KSTClientConnection installer{std::string("com.example.installer"), 0, true, std::nullopt};
};

TEST_F(GroupManagerTest, PathsMakeTheEntitledContainersOfTheUsersKind) {
  entitle("com.example.app",
          PlistDictionary{{kKSTApplicationGroupsEntitlement, PlistArray{"group.a", "group.b"}},
                          {kKSTSystemGroupsEntitlement, PlistArray{"systemgroup.x", "bad"}}});
  struct Row {
    std::uint32_t user;
    const char* identifier;
    KSTContainerClass containerClass;
    std::set<std::string> groups;
  };
  const Row rows[] = {{501, "com.example.app", kApp, {"group.a", "group.b"}},
                      {499, "com.example.app", kSystem, {"systemgroup.x"}},
                      {501, "com.example.unknown", kApp, {}}};
  for (const Row& row : rows) {
    SCOPED_TRACE(std::to_string(row.user) + " " + row.identifier);
    KSTClientConnection client(std::string("com.example.client"), row.user, false, std::nullopt);
    std::uint64_t code = kKSTSuccess;
    const auto paths = KSTGroupManager::defaultManager().groupContainerPathsForUser(
        row.user, client, std::string(row.identifier), &code);
    ASSERT_TRUE(paths.has_value());
    EXPECT_EQ(code, kKSTSuccess);
    EXPECT_TRUE(client.allowGroupIdLookup());
    std::set<std::string> groups;
    for (const auto& [group, path] : *paths) {
      groups.insert(group);
      const KSTMetadataRef container = find(row.user, row.containerClass, group);
      ASSERT_TRUE(container && path.string()) << group;
      EXPECT_EQ(*path.string(), container->url().path());
    }
    EXPECT_EQ(groups, row.groups);
  }
}

TEST_F(GroupManagerTest, MissingIdentifierFailsWith11BeforeAnyLock) {
  // Another holder of the lock on all identifiers must not stall the answer.
  KSTAllIdentifiersLockGuard held(kKSTLockForWriting);
  std::promise<std::pair<std::uint64_t, std::uint64_t>> answered;
  std::thread asker([&] {
    KSTClientConnection client(std::string("com.example.client"), 501, false, std::nullopt);
    std::uint64_t paths = kKSTSuccess, ids = kKSTSuccess;
    KSTGroupManager& manager = KSTGroupManager::defaultManager();
    EXPECT_FALSE(manager.groupContainerPathsForUser(501, client, std::nullopt, &paths));
    EXPECT_FALSE(manager.groupContainerIdentifiersForUser(501, std::nullopt, &ids));
    answered.set_value({paths, ids});
  });
  auto answer = answered.get_future();
  const bool inTime = answer.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
  held.unlock();
  asker.join();
  ASSERT_TRUE(inTime) << "the lookups waited for the lock";
  EXPECT_EQ(answer.get(), std::make_pair(std::uint64_t{11}, std::uint64_t{11}));
  EXPECT_TRUE(fakes.logged(": Can't act on an invalid object: userId: 501, ID: (null)",
                           testing::Match::Suffix));
}

TEST_F(GroupManagerTest, LastReferenceGoingAwayRemovesTheGroupForEveryUser) {
  entitle("com.example.one", PlistDictionary{{kKSTApplicationGroupsEntitlement,
                                              PlistArray{"group.shared", "a", "b"}}});
  entitle("com.example.two", PlistDictionary{{kKSTApplicationGroupsEntitlement, "group.shared"}});
  for (std::uint32_t user : {501u, 502u}) {
    for (const char* group : {"group.shared", "a", "b"}) make(user, kApp, group);
  }
  // Reordered groups drop nothing, although a and b have one reference only;
  // the first of two references to group.shared going away keeps it too.
  change(Strings{"group.shared", "a", "b"}, Strings{"group.shared", "b", "a"}, 0);
  change(Strings{"group.shared", "a", "b"}, Strings{"a", "b"}, 0);
  entitle("com.example.one", PlistDictionary{{kKSTApplicationGroupsEntitlement, "a"}});
  for (std::uint32_t user : {501u, 502u}) {
    SCOPED_TRACE(user);
    for (const char* group : {"group.shared", "a", "b"}) EXPECT_TRUE(exists(user, kApp, group));
  }

  // The last one goes (its new list is absent): gone for every user.
  change(Strings{"group.shared"}, std::nullopt, 0);
  for (std::uint32_t user : {501u, 502u}) EXPECT_FALSE(exists(user, kApp, "group.shared")) << user;
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Last reference to group container group.shared for 502 is going away; removing it."));

  // A system group is removed for 499 only, never from an app group of that name.
  entitle("com.example.sys", PlistDictionary{{kKSTSystemGroupContainersEntitlement, "b"}});
  make(499, kSystem, "b");
  change(Strings{"b"}, Strings{}, kKSTGroupTypeSystem);
  EXPECT_FALSE(exists(499, kSystem, "b"));
  EXPECT_TRUE(exists(501, kApp, "b"));
}

TEST_F(GroupManagerTest, ReconciliationRemovesWhatNoEntryNames) {
  entitle("com.example.kept", PlistDictionary{{kKSTApplicationGroupsEntitlement, "group.kept"}});
  entitle("com.example.old", PlistDictionary{{kKSTApplicationGroupsEntitlement, "group.old"}},
          true);
  for (std::uint32_t user : {501u, 502u}) {
    for (const char* group : {"group.kept", "group.old", "group.orphan"}) make(user, kApp, group);
  }
  make(499, kSystem, "systemgroup.unnamed");

  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  onQueue([](KSTCodeSigningMappingState& state) {
    KSTGroupManager::defaultManager().reconcileGroupContainersOfType(0, state);
  });
  for (std::uint32_t user : {501u, 502u}) {
    SCOPED_TRACE(user);
    EXPECT_TRUE(exists(user, kApp, "group.kept"));
    EXPECT_TRUE(exists(user, kApp, "group.old"));  // invalid entries still count
    EXPECT_FALSE(exists(user, kApp, "group.orphan"));
  }
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Removing group container with identifier group.orphan for 501"));
  EXPECT_TRUE(exists(499, kSystem, "systemgroup.unnamed"));
}

TEST_F(GroupManagerTest, SystemGroupPathCommandServesEntitledAndWellKnownGroupsOnly) {
  entitle("com.example.daemon",
          PlistDictionary{{kKSTSystemGroupsEntitlement, "systemgroup.com.example.shared"}});
  struct Row {
    const char* group;
    std::uint64_t code;
  };
  const Row rows[] = {{"systemgroup.com.example.shared", kKSTSuccess},
                      {"systemgroup.com.zorvane.heron.tiles", kKSTSuccess},  // well known
                      {"systemgroup.com.example.other", kKSTErrorNotEntitled}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.group);
    KSTClientConnection client(std::string("com.example.daemon"), 0, false, std::nullopt);
    platform::MessageDictionary request, reply;
    request.setString("GroupIdentifier", row.group);
    std::uint64_t code = kKSTSuccess;
    const KSTDeferredReply deferred(nullptr, platform::ReceivedMessage(request, nullptr, nullptr));
    KSTCommandContext context{request, reply, client, &code, deferred};
    KSTHandleSystemGroupContainerPath(context);

    EXPECT_EQ(code, row.code);
    const KSTMetadataRef container = find(499, kSystem, row.group);
    if (row.code == kKSTSuccess) {
      EXPECT_TRUE(client.allowGroupIdLookup());
      ASSERT_TRUE(container);
      EXPECT_EQ(reply.string("ReplyPath"), container->url().path());
    } else {
      EXPECT_FALSE(client.allowGroupIdLookup() || container || reply.contains("ReplyPath"));
      EXPECT_TRUE(fakes.logging->contains(
          "systemGroupContainerPath",
          "com.example.daemon is not entitled for system group identifier: " +
              std::string(row.group)));
    }
  }
}

}  // namespace
}  // namespace kestrel
