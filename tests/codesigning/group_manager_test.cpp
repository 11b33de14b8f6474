// Group containers: handed out to entitled identifiers, and removed when the
// last entry that names their group lets go of it.
#include "codesigning/group_manager.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <set>

#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "daemon/locks.h"
#include "store/container_cache.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

using testing::existingContainer;
using Strings = std::vector<std::string>;
constexpr KSTContainerClass kApp = kKSTContainerClassSharedAppGroup;
constexpr KSTContainerClass kSystem = kKSTContainerClassSharedSystemGroup;

class GroupManagerTest : public testing::StoreTest {
 protected:
  GroupManagerTest() {
    // 503 is a session without a home directory: never visited.
    fakes.keyBag->setUserTypeInfo(platform::UserTypeInfo{platform::DeviceMode::MultiUser});
    fakes.keyBag->setUserSessionIds({501, 502, 503});
  }
  // Stores an identifier's entry with these entitlements.
  static void entitle(const std::string& identifier, const char* key, PlistValue groups,
                      bool invalid = false) {
    KSTCodeSigningEntry entry(
        PlistDictionary{{kKSTEntitlementsKey, PlistDictionary{{key, groups}}}}, 2);
    entry.setInvalid(invalid);
    ASSERT_EQ(testing::storeEntries(KSTCodeSigningMapping::sharedInstance(), {entry}, {identifier}),
              nullptr);
  }
  template <typename Fn>
  static void onQueue(Fn&& fn) {
    KSTCodeSigningMapping::sharedInstance().withState(true, [&](KSTCodeSigningMappingState& s) {
      fn(s);
      return true;
    });
  }
  // What processing does on the store's queue when an identifier's groups change.
  static void change(const KSTGroupIdentifiers& old, const KSTGroupIdentifiers& now,
                     KSTGroupType type) {
    onQueue([&](KSTCodeSigningMappingState& state) {
      KSTGroupManager::defaultManager().handleChangeFromOldGroupContainerIds(old, now, type, state);
    });
  }
};

TEST_F(GroupManagerTest, PathsMakeTheEntitledContainersOfTheUsersKind) {
  KSTCodeSigningEntry entry(
      testing::infoWithEntitlements(
          {{kKSTApplicationGroupsEntitlement, PlistArray{"group.a", "group.b"}},
           {kKSTSystemGroupsEntitlement, PlistArray{"systemgroup.x", "bad"}}}),
      2);
  ASSERT_EQ(
      testing::storeEntries(KSTCodeSigningMapping::sharedInstance(), {entry}, {"com.example.app"}),
      nullptr);
  const std::tuple<std::uint32_t, const char*, KSTContainerClass, std::set<std::string>> rows[] = {
      {501, "com.example.app", kApp, {"group.a", "group.b"}},
      {499, "com.example.app", kSystem, {"systemgroup.x"}},
      {501, "com.example.unknown", kApp, {}}};
  for (const auto& [user, identifier, containerClass, expected] : rows) {
    SCOPED_TRACE(std::to_string(user) + " " + identifier);
    KSTClientConnection client(std::string("com.example.client"), user, false, std::nullopt);
    std::uint64_t code = kKSTSuccess;
    const auto paths = KSTGroupManager::defaultManager().groupContainerPathsForUser(
        user, client, std::string(identifier), &code);
    ASSERT_TRUE(paths.has_value());
    EXPECT_EQ(code, kKSTSuccess);
    EXPECT_TRUE(client.allowGroupIdLookup());
    std::set<std::string> groups;
    for (const auto& [group, path] : *paths) {
      groups.insert(group);
      const KSTMetadataRef container = existingContainer(user, containerClass, group);
      ASSERT_TRUE(container && path.string()) << group;
      EXPECT_EQ(*path.string(), container->url().path());
    }
    EXPECT_EQ(groups, expected);
  }
}

TEST_F(GroupManagerTest, MissingIdentifierFailsWith11BeforeAnyLock) {
  // Another holder of the lock on all identifiers must not stall the answer.
  KSTAllIdentifiersLockGuard held(kKSTLockForWriting);
  auto answer = std::async(std::launch::async, [] {
    KSTClientConnection client(std::string("com.example.client"), 501, false, std::nullopt);
    KSTGroupManager& manager = KSTGroupManager::defaultManager();
    std::uint64_t paths = kKSTSuccess, ids = kKSTSuccess;
    const bool found = manager.groupContainerPathsForUser(501, client, std::nullopt, &paths) ||
                       manager.groupContainerIdentifiersForUser(501, std::nullopt, &ids);
    return std::tuple(found, paths, ids);
  });
  const bool inTime = answer.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
  held.unlock();
  ASSERT_TRUE(inTime) << "the lookups waited for the lock";
  EXPECT_EQ(answer.get(), std::tuple(false, std::uint64_t{11}, std::uint64_t{11}));
  EXPECT_TRUE(fakes.logged(": Can't act on an invalid object: userId: 501, ID: (null)",
                           testing::Match::Suffix));
}

TEST_F(GroupManagerTest, LastReferenceGoingAwayRemovesTheGroupForEveryUser) {
  entitle("com.example.one", kKSTApplicationGroupsEntitlement,
          PlistArray{"group.shared", "a", "b"});
  entitle("com.example.two", kKSTApplicationGroupsEntitlement, "group.shared");
  for (std::uint32_t user : {501u, 502u}) {
    for (const char* group : {"group.shared", "a", "b"}) make(user, kApp, group);
  }
  // Reordered groups drop nothing, although a and b have one reference only;
  // the first of two references to group.shared going away keeps it too.
  change(Strings{"group.shared", "a", "b"}, Strings{"group.shared", "b", "a"}, 0);
  change(Strings{"group.shared", "a", "b"}, Strings{"a", "b"}, 0);
  entitle("com.example.one", kKSTApplicationGroupsEntitlement, "a");
  for (std::uint32_t user : {501u, 502u}) {
    for (const char* group : {"group.shared", "a", "b"}) {
      EXPECT_TRUE(existingContainer(user, kApp, group)) << user << " " << group;
    }
  }
  // The last one goes (its new list is absent): gone for every user.
  change(Strings{"group.shared"}, std::nullopt, 0);
  for (std::uint32_t user : {501u, 502u}) {
    EXPECT_FALSE(existingContainer(user, kApp, "group.shared")) << user;
  }
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Last reference to group container group.shared for 502 is going away; removing it."));
  // A system group is removed for 499 only, never from an app group of that name.
  entitle("com.example.sys", kKSTSystemGroupContainersEntitlement, "b");
  make(499, kSystem, "b");
  change(Strings{"b"}, Strings{}, kKSTGroupTypeSystem);
  EXPECT_FALSE(existingContainer(499, kSystem, "b"));
  EXPECT_TRUE(existingContainer(501, kApp, "b"));
}

TEST_F(GroupManagerTest, ReconciliationRemovesWhatNoEntryNames) {
  entitle("com.example.kept", kKSTApplicationGroupsEntitlement, "group.kept");
  entitle("com.example.old", kKSTApplicationGroupsEntitlement, "group.old", true);
  for (std::uint32_t user : {501u, 502u}) {
    for (const char* group : {"group.kept", "group.old", "group.orphan"}) make(user, kApp, group);
  }
  make(499, kSystem, "systemgroup.unnamed");
  KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
  onQueue([](KSTCodeSigningMappingState& state) {
    KSTGroupManager::defaultManager().reconcileGroupContainersOfType(0, state);
  });
  for (std::uint32_t user : {501u, 502u}) {
    EXPECT_TRUE(existingContainer(user, kApp, "group.kept")) << user;
    EXPECT_TRUE(existingContainer(user, kApp, "group.old")) << user;  // invalid entries count
    EXPECT_FALSE(existingContainer(user, kApp, "group.orphan")) << user;
  }
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Removing group container with identifier group.orphan for 501"));
  EXPECT_TRUE(existingContainer(499, kSystem, "systemgroup.unnamed"));
}

TEST_F(GroupManagerTest, SystemGroupPathCommandServesEntitledAndWellKnownGroupsOnly) {
  entitle("com.example.daemon", kKSTSystemGroupsEntitlement, "systemgroup.com.example.shared");
  const std::tuple<const char*, std::uint64_t> rows[] = {
      {"systemgroup.com.example.shared", kKSTSuccess},
      {"systemgroup.com.zorvane.heron.tiles", kKSTSuccess},  // well known
      {"systemgroup.com.example.other", kKSTErrorNotEntitled}};
  for (const auto& [group, code] : rows) {
    SCOPED_TRACE(group);
    KSTClientConnection client(std::string("com.example.daemon"), 0, false, std::nullopt);
    platform::MessageDictionary reply;
    EXPECT_EQ(testing::runHandler(KSTHandleSystemGroupContainerPath, client,
                                  testing::request({{"GroupIdentifier", group}}), &reply),
              code);
    const KSTMetadataRef container = existingContainer(499, kSystem, group);
    if (code == kKSTSuccess) {
      EXPECT_TRUE(client.allowGroupIdLookup());
      ASSERT_TRUE(container);
      EXPECT_EQ(reply.string("ReplyPath"), container->url().path());
    } else {
      EXPECT_FALSE(client.allowGroupIdLookup() || container || reply.contains("ReplyPath"));
      EXPECT_TRUE(fakes.logging->contains(
          "systemGroupContainerPath",
          "com.example.daemon is not entitled for system group identifier: " + std::string(group)));
    }
  }
}

}  // namespace
}  // namespace kestrel
