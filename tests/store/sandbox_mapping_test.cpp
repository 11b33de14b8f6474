#include <gtest/gtest.h>

#include <cerrno>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "daemon/client_connection.h"
#include "platform/fake/fake_sandbox.h"
#include "platform/linux/sandbox_linux.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using platform::FakeSandbox;
using platform::FakeSandboxCall;

constexpr const char* kTag = "_setSandboxContainerMappingForUser";

class SandboxMappingTest : public ::testing::Test {
 protected:
  SandboxMappingTest() {
    fakes.services.sandbox = sandbox;
    fakes.install();
  }

  bool setMapping(std::uint32_t userId, const std::string& identifier,
                  KSTContainerClass containerClass, const std::optional<KSTFileURL>& url) {
    return connection._setSandboxContainerMappingForUser(userId, identifier, containerClass, url);
  }

  testing::FakeServices fakes;
  std::shared_ptr<FakeSandbox> sandbox = std::make_shared<FakeSandbox>();
  KSTClientConnection connection{std::string("com.example.installer"), false};
};

TEST_F(SandboxMappingTest, EachClassMapsToItsItemTypeAndUser) {
  struct Row {
    KSTContainerClass containerClass;
    std::uint32_t userId;
    bool mapped;
    std::uint64_t itemType;
    std::uint32_t sandboxUser;
  } rows[] = {
      {1, 33, false, 0, 0},    {8, 33, false, 0, 0},   {2, 501, true, 1, 501},
      {11, 502, true, 1, 502}, {7, 501, true, 2, 501}, {12, 499, true, 4, 0},
      {13, 501, true, 8, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::Message() << "class " << row.containerClass << " user " << row.userId);
    sandbox->clearCalls();
    const std::string path = "/private/var/containers/" +
                             std::string(KSTContainerClassPath(row.containerClass)) + "/UUID";
    EXPECT_TRUE(
        setMapping(row.userId, "com.example.item", row.containerClass, KSTFileURL(path, true)));
    if (!row.mapped) {
      EXPECT_TRUE(sandbox->calls().empty());
      continue;
    }
    const std::vector<FakeSandboxCall> expected = {
        {row.sandboxUser, row.itemType, "com.example.item", std::nullopt, 0},
        {row.sandboxUser, row.itemType, "com.example.item", path, 0},
    };
    EXPECT_EQ(sandbox->calls(), expected);
    EXPECT_EQ(sandbox->userStateItem(row.sandboxUser, row.itemType, "com.example.item"), path);
  }
}

TEST_F(SandboxMappingTest, NoURLRemovesTheItemWithOneCall) {
  ASSERT_TRUE(setMapping(501, "com.example.app", 2, KSTFileURL("/data/OLD", true)));
  sandbox->clearCalls();

  EXPECT_TRUE(setMapping(501, "com.example.app", 2, std::nullopt));
  const std::vector<FakeSandboxCall> expected = {{501, 1, "com.example.app", std::nullopt, 0}};
  EXPECT_EQ(sandbox->calls(), expected);
  EXPECT_EQ(sandbox->userStateItem(501, 1, "com.example.app"), std::nullopt);
}

TEST_F(SandboxMappingTest, BoundsAndUnknownClassesAreRefused) {
  for (KSTContainerClass containerClass : {KSTContainerClass{0}, KSTContainerClass{14}}) {
    SCOPED_TRACE(containerClass);
    fakes.logging->clear();
    EXPECT_FALSE(setMapping(501, "com.example.app", containerClass, KSTFileURL("/data/X", true)));
    EXPECT_TRUE(sandbox->calls().empty());
    EXPECT_TRUE(
        fakes.logging->contains(kTag, "Unsupported class for setting sandbox container mapping: " +
                                          std::to_string(containerClass)));
  }
}

TEST_F(SandboxMappingTest, FailedRemovalLeavesTheNewItemUnset) {
  sandbox->setRemoveStatus(EPERM);
  EXPECT_FALSE(setMapping(499, "systemgroup.com.example", 13, KSTFileURL("/sys/NEW", true)));
  const std::vector<FakeSandboxCall> expected = {
      {0, 8, "systemgroup.com.example", std::nullopt, 0}};
  EXPECT_EQ(sandbox->calls(), expected);
  EXPECT_TRUE(fakes.logging->contains(
      kTag,
      "Failed to remove mapping for user: 0, itemType: 8, identifier: systemgroup.com.example, "
      "class: 13, path: (null) : 1"));
  EXPECT_EQ(sandbox->userStateItem(0, 8, "systemgroup.com.example"), std::nullopt);
}

TEST_F(SandboxMappingTest, FailedSettingIsLoggedAndLeavesNoItem) {
  ASSERT_TRUE(setMapping(501, "group.com.example", 7, KSTFileURL("/groups/OLD", true)));
  sandbox->clearCalls();
  sandbox->setSetStatus(ENOSPC);

  EXPECT_FALSE(setMapping(501, "group.com.example", 7, KSTFileURL("/groups/NEW", true)));
  EXPECT_EQ(sandbox->calls().size(), 2u);
  EXPECT_TRUE(fakes.logging->contains(
      kTag,
      "Failed to set mapping for user: 501, itemType: 2, identifier group.com.example, "
      "class: 7, path: /groups/NEW : " +
          std::to_string(ENOSPC)));
  EXPECT_EQ(sandbox->userStateItem(501, 2, "group.com.example"), std::nullopt);
}

TEST_F(SandboxMappingTest, WithoutASandboxTheMappingFailsInsteadOfCrashing) {
  fakes.services.sandbox = nullptr;
  fakes.install();
  EXPECT_FALSE(setMapping(501, "com.example.app", 2, KSTFileURL("/data/X", true)));
  EXPECT_TRUE(fakes.logging->contains(
      kTag,
      "Failed to remove mapping for user: 501, itemType: 1, identifier: com.example.app, "
      "class: 2, path: (null) : " +
          std::to_string(ENOSYS)));
}

TEST(LinuxSandboxTest, KeepsOneItemPerUserTypeAndIdentifier) {
  platform::LinuxSandbox sandbox;
  EXPECT_EQ(sandbox.setUserStateItem(501, 1, "com.example.app", "/a", 0), 0);
  EXPECT_EQ(sandbox.setUserStateItem(501, 1, "com.example.app", "/b", 0), 0);
  EXPECT_EQ(sandbox.setUserStateItem(502, 1, "com.example.app", "/c", 0), 0);
  EXPECT_EQ(sandbox.setUserStateItem(501, 2, "com.example.app", "/d", 0), 0);
  EXPECT_EQ(sandbox.userStateItem(501, 1, "com.example.app"), "/b");
  EXPECT_EQ(sandbox.userStateItems().size(), 3u);

  EXPECT_EQ(sandbox.setUserStateItem(501, 1, "com.example.app", std::nullopt, 0), 0);
  EXPECT_EQ(sandbox.setUserStateItem(501, 1, "never.set", std::nullopt, 0), 0);
  EXPECT_EQ(sandbox.userStateItem(501, 1, "com.example.app"), std::nullopt);
  EXPECT_EQ(sandbox.userStateItem(502, 1, "com.example.app"), "/c");

  EXPECT_EQ(sandbox.setUserStateItem(501, 1, "x", "/e", 1), EINVAL);
  EXPECT_EQ(sandbox.setUserStateItem(501, 1, std::string("x\0y", 3), "/e", 0), EINVAL);
  EXPECT_EQ(sandbox.userStateItems().size(), 2u);
}

}  // namespace
}  // namespace kestrel
