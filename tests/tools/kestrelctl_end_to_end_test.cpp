// kestrelctl's named subcommands against the real daemon.
#include <gtest/gtest.h>

#include <filesystem>

#include "support/registered_clients.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kDeathRow = "/private/var/root/Library/Caches/com.zorvane.kestreld/Dead";

using KestrelctlEndToEndTest = testing::RegisteredClientsTest;

TEST_F(KestrelctlEndToEndTest, NamedSubcommandsPrintForPeopleOrAsJson) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::string deathRow = scratch.resolve(kDeathRow);

  scratch.writeFile(std::string(kDeathRow) + "/temp.a1b2c3/Data/Library/Preferences/a.plist", "a");
  scratch.writeFile(std::string(kDeathRow) + "/5F1C0E2A-UUID/Documents/b", "b");
  auto refused = ctl("plain-client", {"sweep"});
  EXPECT_EQ(refused.exitStatus, 4) << refused.output;
  EXPECT_FALSE(fs::is_empty(deathRow));

  auto swept = ctl("allowed-client", {"sweep"});
  EXPECT_EQ(swept.exitStatus, 0) << swept.output;
  EXPECT_EQ(swept.output, "death row swept\n");
  EXPECT_TRUE(fs::is_empty(deathRow));

  scratch.writeFile(std::string(kDeathRow) + "/temp.d4e5f6/Documents/b", "b");
  auto json = ctl("allowed-client", {"--json", "sweep"});
  EXPECT_EQ(json.exitStatus, 0) << json.output;
  EXPECT_EQ(json.output, "{\n  \"ReplyError\": 1\n}\n");
  EXPECT_TRUE(fs::is_empty(deathRow));

  auto unknown = ctl("allowed-client", {"code-signing-info", "--identifier", "com.example.none"});
  EXPECT_EQ(unknown.exitStatus, 1) << unknown.output;
  EXPECT_EQ(unknown.output, "kestrelctl: code-signing-info failed: error 21 (not found)\n");
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace kestrel
