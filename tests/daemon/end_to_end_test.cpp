// The real daemon on a scratch root, talked to by separate client processes
// that carry different registered identities.
#include <gtest/gtest.h>

#include "platform/linux/named_semaphores_linux.h"
#include "support/registered_clients.h"

namespace kestrel {
namespace {

using EndToEndTest = testing::RegisteredClientsTest;

TEST_F(EndToEndTest, ClientsAreAnsweredOrRefusedByTheirRegisteredEntitlements) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());

  auto allowed = call("allowed-client", {"25", "UserID=u64:501"});
  EXPECT_EQ(allowed.exitStatus, 0) << allowed.output;
  EXPECT_NE(allowed.output.find("\"ReplyError\": 1"), std::string::npos) << allowed.output;

  auto plain = call("plain-client", {"25", "UserID=u64:501"});
  EXPECT_EQ(plain.exitStatus, 4) << plain.output;  // refused: the connection is closed

  auto badUser = call("allowed-client", {"25", "UserID=u64:0"});
  EXPECT_EQ(badUser.exitStatus, 1) << badUser.output;
  EXPECT_NE(badUser.output.find("\"ReplyError\": 38"), std::string::npos) << badUser.output;

  auto badIndex = call("allowed-client", {"27"});
  EXPECT_EQ(badIndex.exitStatus, 4) << badIndex.output;

  // The daemon still serves after refusing.
  EXPECT_EQ(call("allowed-client", {"25", "UserID=u64:1"}).exitStatus, 0);
  EXPECT_EQ(daemon.stop(), 0);

  const std::string text = log();
  EXPECT_NE(
      text.find("retryTest: People really shouldn't be calling this on non-internal installs!"),
      std::string::npos);
  EXPECT_NE(text.find("connection attempt from pid"), std::string::npos);
  EXPECT_NE(text.find("(com.example.app) missing required entitlement: "
                      "com.zorvane.private.Kestrel.allowed"),
            std::string::npos);
  EXPECT_NE(text.find("Invalid command index: 27"), std::string::npos);
  EXPECT_NE(text.find("main: Received signal 15, exiting"), std::string::npos);
}

TEST_F(EndToEndTest, OnlyTheFirstStartSinceBootDoesTheBootTimeWork) {
  const auto startAndStop = [&] {
    testing::DaemonProcess daemon(scratch.path());
    ASSERT_TRUE(daemon.ready());
    EXPECT_EQ(daemon.stop(), 0);
  };
  const auto count = [&](const std::string& needle) {
    const std::string text = log();
    std::size_t n = 0;
    for (auto pos = text.find(needle); pos != std::string::npos; pos = text.find(needle, pos + 1))
      ++n;
    return n;
  };
  startAndStop();
  startAndStop();
  EXPECT_EQ(count("kestreld performing first boot initialization"), 1u);
  EXPECT_EQ(count("Received signal 15, exiting"), 2u);

  // "Reboot": the mark goes, so the next start repeats the boot-time work.
  platform::LinuxNamedSemaphores(scratch.root()).remove("kestreld.fb_check");
  startAndStop();
  EXPECT_EQ(count("kestreld performing first boot initialization"), 2u);
}

}  // namespace
}  // namespace kestrel
