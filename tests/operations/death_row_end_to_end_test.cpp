// The real daemon sweeps death row for a client entitled to ask, and answers
// once the sweep has ended.
#include <gtest/gtest.h>

#include <filesystem>

#include "support/registered_clients.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kDeathRow = "/private/var/root/Library/Caches/com.zorvane.kestreld/Dead";

using DeathRowEndToEndTest = testing::RegisteredClientsTest;

TEST_F(DeathRowEndToEndTest, EntitledClientGetsDeathRowSwept) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::string deathRow = scratch.resolve(kDeathRow);
  scratch.writeFile(std::string(kDeathRow) + "/temp.a1b2c3/Data/Library/Preferences/a.plist", "a");
  scratch.writeFile(std::string(kDeathRow) + "/5F1C0E2A-UUID/Documents/b", "b");

  auto refused = call("plain-client", {"4"});
  EXPECT_EQ(refused.exitStatus, 4) << refused.output;
  EXPECT_FALSE(fs::is_empty(deathRow));

  auto swept = call("allowed-client", {"4"});
  EXPECT_EQ(swept.exitStatus, 0) << swept.output;
  EXPECT_NE(swept.output.find("\"ReplyError\": 1"), std::string::npos) << swept.output;
  EXPECT_TRUE(fs::is_empty(deathRow));
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace kestrel
