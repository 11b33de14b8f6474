// The real daemon on a scratch root, talked to by separate client processes
// that carry different registered identities.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "platform/linux/named_semaphores_linux.h"
#include "support/daemon_process.h"
#include "support/scratch_root.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class EndToEndTest : public ::testing::Test {
 protected:
  EndToEndTest() {
    fs::create_directories(scratch.resolve("/etc/kestrel/signatures"));
    fs::permissions(scratch.resolve("/etc/kestrel"), fs::perms(0755));
    fs::permissions(scratch.resolve("/etc/kestrel/signatures"), fs::perms(0755));
    registerClient("allowed-client", "com.example.installer",
                   "<key>com.zorvane.private.Kestrel.allowed</key><true/>");
    registerClient("plain-client", "com.example.app", "");
  }

  // The first-boot mark of this root goes with the root.
  ~EndToEndTest() override { platform::LinuxNamedSemaphores(scratch.root()).remove("kestreld.fb_check"); }

  // A copy of kestrelctl that the registry knows under the identifier.
  void registerClient(const std::string& name, const std::string& identifier,
                      const std::string& entitlements) {
    const std::string binary = scratch.resolve("/bin/" + name);
    fs::create_directories(scratch.resolve("/bin"));
    fs::copy_file(KESTRELCTL_BINARY, binary, fs::copy_options::overwrite_existing);
    fs::permissions(binary, fs::perms(0755));
    scratch.writeFile("/etc/kestrel/signatures/" + name + ".plist",
                      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                      "<key>SigningIdentifier</key><string>" + identifier + "</string>"
                      "<key>Executable</key><string>" + binary + "</string>"
                      "<key>Entitlements</key><dict>" + entitlements + "</dict>"
                      "</dict></plist>\n");
    fs::permissions(scratch.resolve("/etc/kestrel/signatures/" + name + ".plist"), fs::perms(0644));
  }

  testing::ProcessResult call(const std::string& client, std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"--root", scratch.path(), "call"});
    return testing::runProcess(scratch.resolve("/bin/" + client), arguments);
  }

  std::string log() const {
    return scratch.readFile("/private/var/root/Library/Logs/Kestrel/kestreld.log");
  }

  testing::ScratchRoot scratch;
};

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
  EXPECT_NE(text.find("retryTest: People really shouldn't be calling this on non-internal installs!"),
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
    for (auto pos = text.find(needle); pos != std::string::npos; pos = text.find(needle, pos + 1)) ++n;
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
