#include <gtest/gtest.h>

#include <cerrno>
#include <optional>
#include <string>
#include <vector>

#include "daemon/client_connection.h"
#include "platform/fake/fake_sandbox.h"
#include "platform/linux/sandbox_linux.h"
#include "store/container_class.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using Calls = std::vector<platform::FakeSandboxCall>;

constexpr const char* kTag = "_setSandboxContainerMappingForUser";

class SandboxMappingTest : public ::testing::Test {
 protected:
  bool setMapping(std::uint32_t userId, const std::string& identifier,
                  KSTContainerClass containerClass, const std::optional<std::string>& path) {
    return connection._setSandboxContainerMappingForUser(
        userId, identifier, containerClass,
        path ? std::optional(KSTFileURL(*path, true)) : std::nullopt);
  }
  bool logged(const std::string& message) const { return fakes.logging->contains(kTag, message); }

  testing::FakeServices fakes;
  platform::FakeSandbox& sandbox = *fakes.sandbox;
  KSTClientConnection connection{std::string("com.example.installer"), false};
};

TEST_F(SandboxMappingTest, EachClassMapsToItsItemTypeAndUserAndNoURLRemovesTheItem) {
  // Class, user, whether it is mapped, item type and the user the sandbox is told.
  const std::tuple<KSTContainerClass, std::uint32_t, bool, std::uint64_t, std::uint32_t> rows[] = {
      {1, 33, false, 0, 0},    {8, 33, false, 0, 0},   {2, 501, true, 1, 501},
      {11, 502, true, 1, 502}, {7, 501, true, 2, 501}, {12, 499, true, 4, 0},
      {13, 501, true, 8, 0},
  };
  for (const auto& [containerClass, user, mapped, itemType, sandboxUser] : rows) {
    SCOPED_TRACE(::testing::Message() << "class " << containerClass << " user " << user);
    sandbox.clearCalls();
    const std::string path =
        "/private/var/containers/" + std::string(KSTContainerClassPath(containerClass)) + "/UUID";
    EXPECT_TRUE(setMapping(user, "com.example.item", containerClass, path));
    const Calls expected = {{sandboxUser, itemType, "com.example.item", std::nullopt, 0},
                            {sandboxUser, itemType, "com.example.item", path, 0}};
    EXPECT_EQ(sandbox.calls(), mapped ? expected : Calls{});
    EXPECT_EQ(sandbox.userStateItem(sandboxUser, itemType, "com.example.item"),
              mapped ? std::optional(path) : std::nullopt);
  }
  sandbox.clearCalls();
  EXPECT_TRUE(setMapping(501, "com.example.item", 2, std::nullopt));
  EXPECT_EQ(sandbox.calls(), (Calls{{501, 1, "com.example.item", std::nullopt, 0}}));
  EXPECT_EQ(sandbox.userStateItem(501, 1, "com.example.item"), std::nullopt);
}

TEST_F(SandboxMappingTest, RefusalsAndFailuresAreLoggedAndLeaveNoItem) {
  for (KSTContainerClass containerClass : {KSTContainerClass{0}, KSTContainerClass{14}}) {
    EXPECT_FALSE(setMapping(501, "com.example.app", containerClass, "/data/X"));
    EXPECT_TRUE(logged("Unsupported class for setting sandbox container mapping: " +
                       std::to_string(containerClass)));
  }
  EXPECT_TRUE(sandbox.calls().empty());

  // A failed removal leaves the new item unset.
  sandbox.setRemoveStatus(EPERM);
  EXPECT_FALSE(setMapping(499, "systemgroup.com.example", 13, "/sys/NEW"));
  EXPECT_EQ(sandbox.calls(), (Calls{{0, 8, "systemgroup.com.example", std::nullopt, 0}}));
  EXPECT_TRUE(logged(
      "Failed to remove mapping for user: 0, itemType: 8, identifier: systemgroup.com.example, "
      "class: 13, path: (null) : 1"));
  EXPECT_EQ(sandbox.userStateItem(0, 8, "systemgroup.com.example"), std::nullopt);

  // A failed setting is logged, and the old item is gone too.
  sandbox.setRemoveStatus(0);
  ASSERT_TRUE(setMapping(501, "group.com.example", 7, "/groups/OLD"));
  sandbox.clearCalls();
  sandbox.setSetStatus(ENOSPC);
  EXPECT_FALSE(setMapping(501, "group.com.example", 7, "/groups/NEW"));
  EXPECT_EQ(sandbox.calls().size(), 2u);
  EXPECT_TRUE(logged(
      "Failed to set mapping for user: 501, itemType: 2, identifier group.com.example, class: 7, "
      "path: /groups/NEW : " +
      std::to_string(ENOSPC)));
  EXPECT_EQ(sandbox.userStateItem(501, 2, "group.com.example"), std::nullopt);

  // Without a sandbox the mapping fails instead of crashing.
  fakes.services.sandbox = nullptr;
  fakes.install();
  EXPECT_FALSE(setMapping(501, "com.example.app", 2, "/data/X"));
  EXPECT_TRUE(
      logged("Failed to remove mapping for user: 501, itemType: 1, identifier: com.example.app, "
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
