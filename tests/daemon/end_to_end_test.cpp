// The real daemon on a scratch root, talked to by separate client processes
// (copies of kestrelctl) that carry different registered identities.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <vector>

#include "platform/linux/named_semaphores_linux.h"
#include "platform/unique_fd.h"
#include "support/registered_clients.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using EndToEndTest = testing::RegisteredClientsTest;

constexpr const char* kDeathRow = "/private/var/root/Library/Caches/com.zorvane.kestreld/Dead";

TEST_F(EndToEndTest, ClientsAreAnsweredOrRefusedByTheirRegisteredEntitlements) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());

  auto allowed = call("allowed-client", {"25", "UserID=u64:501"});
  EXPECT_EQ(allowed.exitStatus, 0) << allowed.output;
  EXPECT_NE(allowed.output.find("\"ReplyError\": 1"), std::string::npos) << allowed.output;

  auto plain = call("plain-client", {"25", "UserID=u64:501"});
  EXPECT_EQ(plain.exitStatus, 4) << plain.output;  // refused: the connection is closed
  // Its Entitlements dictionary is empty: no entitlements at all, not even for command 0.
  EXPECT_EQ(ctl("plain-client", {"create", "--class", "2", "--user", "501"}).exitStatus, 4);

  // A key of the wrong type reads as absent: an "Identifier" number names no
  // identifier, so the client's own is used.
  auto ownIdentifier = call("allowed-client", {"0", "ContainerClass=u64:2", "UserID=u64:501",
                                               "CreateIfNecessary=bool:true", "Identifier=u64:5"});
  EXPECT_EQ(ownIdentifier.exitStatus, 0) << ownIdentifier.output;
  EXPECT_NE(ownIdentifier.output.find("\"ReplyIdentifier\": \"com.example.installer\""),
            std::string::npos)
      << ownIdentifier.output;

  auto badUser = call("allowed-client", {"25", "UserID=u64:0"});
  EXPECT_EQ(badUser.exitStatus, 1) << badUser.output;
  EXPECT_NE(badUser.output.find("\"ReplyError\": 38"), std::string::npos) << badUser.output;

  auto badIndex = call("allowed-client", {"27"});
  EXPECT_EQ(badIndex.exitStatus, 4) << badIndex.output;

  // The daemon still serves after refusing.
  EXPECT_EQ(call("allowed-client", {"25", "UserID=u64:1"}).exitStatus, 0);

  // kestrelctl's named subcommands print for people, or as JSON.
  scratch.writeFile(std::string(kDeathRow) + "/temp.a1b2c3/Data/Library/Preferences/a.plist", "a");
  scratch.writeFile(std::string(kDeathRow) + "/5F1C0E2A-UUID/Documents/b", "b");
  auto refused = ctl("plain-client", {"sweep"});
  EXPECT_EQ(refused.exitStatus, 4) << refused.output;
  EXPECT_FALSE(fs::is_empty(scratch.resolve(kDeathRow)));
  auto swept = ctl("allowed-client", {"sweep"});
  EXPECT_EQ(swept.exitStatus, 0) << swept.output;
  EXPECT_EQ(swept.output, "death row swept\n");
  EXPECT_TRUE(fs::is_empty(scratch.resolve(kDeathRow)));
  scratch.writeFile(std::string(kDeathRow) + "/temp.d4e5f6/Documents/b", "b");
  auto json = ctl("allowed-client", {"--json", "sweep"});
  EXPECT_EQ(json.exitStatus, 0) << json.output;
  EXPECT_EQ(json.output, "{\n  \"ReplyError\": 1\n}\n");
  EXPECT_TRUE(fs::is_empty(scratch.resolve(kDeathRow)));
  auto unknown = ctl("allowed-client", {"code-signing-info", "--identifier", "com.example.none"});
  EXPECT_EQ(unknown.exitStatus, 1) << unknown.output;
  EXPECT_EQ(unknown.output, "kestrelctl: code-signing-info failed: error 21 (not found)\n");
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

  // "Reboot": kestrelctl takes the mark away, so the next start repeats the boot-time work.
  const std::string mark = platform::scopedSemaphoreName(scratch.root(), "kestreld.fb_check");
  EXPECT_EQ(ctl("plain-client", {"reset-first-boot"}).output, "removed " + mark + "\n");
  EXPECT_EQ(ctl("plain-client", {"reset-first-boot"}).output, "not present: " + mark + "\n");
  startAndStop();
  EXPECT_EQ(count("kestreld performing first boot initialization"), 2u);
  EXPECT_EQ(ctl("plain-client", {"reset-first-boot"}).output, "removed " + mark + "\n");
}

// As systemd runs it (Type=notify, WatchdogSec=): READY=1 once it serves,
// WATCHDOG=1 from its main queue twice per interval, STOPPING=1 on SIGTERM.
TEST_F(EndToEndTest, TellsTheServiceManagerItIsReadyAliveAndStopping) {
  if (const char* wrapper = std::getenv("KESTREL_TEST_DAEMON_WRAPPER"); wrapper && *wrapper) {
    GTEST_SKIP() << "a confined daemon answers the real service manager";
  }
  const std::string path = scratch.path() + "/notify";
  platform::UniqueFd socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  std::memcpy(address.sun_path, path.c_str(), path.size());
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);

  std::vector<std::string> messages;
  const auto receiveUntil = [&](auto done) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!done() && std::chrono::steady_clock::now() < deadline) {
      pollfd ready{socket.get(), POLLIN, 0};
      if (::poll(&ready, 1, 100) != 1) continue;
      char buffer[4096];
      const ssize_t n = ::recv(socket.get(), buffer, sizeof buffer, 0);
      if (n > 0) messages.emplace_back(buffer, static_cast<std::size_t>(n));
    }
  };
  const auto first = [&](const std::string& message) {
    return std::find(messages.begin(), messages.end(), message) - messages.begin();
  };

  testing::DaemonProcess daemon(scratch.path(), {"NOTIFY_SOCKET=" + path, "WATCHDOG_USEC=200000"});
  ASSERT_TRUE(daemon.ready());
  receiveUntil([&] { return std::count(messages.begin(), messages.end(), "WATCHDOG=1") >= 3; });
  EXPECT_GE(std::count(messages.begin(), messages.end(), "WATCHDOG=1"), 3);
  EXPECT_LT(first("READY=1"), first("WATCHDOG=1"));  // the watchdog runs from readiness on
  EXPECT_EQ(daemon.stop(), 0);
  receiveUntil([&] { return first("STOPPING=1") < std::ssize(messages); });
  EXPECT_LT(first("STOPPING=1"), std::ssize(messages));
}

}  // namespace
}  // namespace kestrel
