// The real daemon sweeps death row for a client entitled to ask, and answers
// once the sweep has ended.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "platform/linux/named_semaphores_linux.h"
#include "support/daemon_process.h"
#include "support/scratch_root.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kDeathRow = "/private/var/root/Library/Caches/com.zorvane.kestreld/Dead";

class DeathRowEndToEndTest : public ::testing::Test {
 protected:
  DeathRowEndToEndTest() {
    fs::create_directories(scratch.resolve("/etc/kestrel/signatures"));
    fs::permissions(scratch.resolve("/etc/kestrel"), fs::perms(0755));
    fs::permissions(scratch.resolve("/etc/kestrel/signatures"), fs::perms(0755));
    registerClient("allowed-client", "com.example.installer",
                   "<key>com.zorvane.private.Kestrel.allowed</key><true/>");
    registerClient("plain-client", "com.example.app", "");
  }

  ~DeathRowEndToEndTest() override {
    platform::LinuxNamedSemaphores(scratch.root()).remove("kestreld.fb_check");
  }

  // A copy of kestrelctl that the registry knows under the identifier.
  void registerClient(const std::string& name, const std::string& identifier,
                      const std::string& entitlements) {
    const std::string binary = scratch.resolve("/bin/" + name);
    fs::create_directories(scratch.resolve("/bin"));
    fs::copy_file(KESTRELCTL_BINARY, binary, fs::copy_options::overwrite_existing);
    fs::permissions(binary, fs::perms(0755));
    const std::string plist = "/etc/kestrel/signatures/" + name + ".plist";
    scratch.writeFile(plist,
                      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                      "<key>SigningIdentifier</key><string>" +
                          identifier +
                          "</string>"
                          "<key>Executable</key><string>" +
                          binary +
                          "</string>"
                          "<key>Entitlements</key><dict>" +
                          entitlements +
                          "</dict>"
                          "</dict></plist>\n");
    fs::permissions(scratch.resolve(plist), fs::perms(0644));
  }

  testing::ProcessResult call(const std::string& client, std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"--root", scratch.path(), "call"});
    return testing::runProcess(scratch.resolve("/bin/" + client), arguments);
  }

  testing::ScratchRoot scratch;
};

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
