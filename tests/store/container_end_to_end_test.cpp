// Commands 0, 1 and 15 through the real daemon, from clients of different
// identities and rights.
#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "support/registered_clients.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

// The value of a "name  value" line of kestrelctl's output for people.
std::string fact(const std::string& output, const std::string& name) {
  const std::size_t at = output.find(name + " ");
  if (at == std::string::npos) return {};
  const std::size_t start = output.find_first_not_of(' ', at + name.size());
  return output.substr(start, output.find('\n', start) - start);
}

class ContainerEndToEndTest : public testing::RegisteredClientsTest {
 protected:
  ContainerEndToEndTest() {
    registerClient("app-client", "com.example.app",
                   "<key>com.zorvane.private.Kestrel.none</key><true/>");
  }
};

TEST_F(ContainerEndToEndTest, AppGetsItsOwnContainersAndTheInstallerListsThem) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());

  // No identifier: the client's own.
  auto made = ctl("app-client", {"create", "--class", "Data/Application", "--user", "501"});
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  EXPECT_EQ(fact(made.output, "identifier"), "com.example.app");
  EXPECT_EQ(fact(made.output, "existed"), "no");
  const std::string path = fact(made.output, "path");
  EXPECT_TRUE(fs::exists(path + "/.com.zorvane.kestrel.metadata.plist")) << made.output;
  EXPECT_TRUE(fs::is_directory(path + "/Library/Preferences"));

  auto again = ctl("app-client", {"lookup", "--class", "2", "--user", "1"});
  ASSERT_EQ(again.exitStatus, 0) << again.output;
  EXPECT_EQ(fact(again.output, "existed"), "yes");
  EXPECT_EQ(fact(again.output, "path"), path);
  EXPECT_EQ(fact(again.output, "uuid"), fact(made.output, "uuid"));

  // Listing needs "allowed"; the installer has it.
  EXPECT_EQ(ctl("app-client", {"list", "--class", "2", "--user", "501"}).exitStatus, 4);
  auto listed = ctl("allowed-client", {"--json", "list", "--class", "2", "--user", "501"});
  ASSERT_EQ(listed.exitStatus, 0) << listed.output;
  EXPECT_NE(listed.output.find("\"com.example.app\""), std::string::npos) << listed.output;
  EXPECT_NE(listed.output.find(fact(made.output, "uuid")), std::string::npos) << listed.output;

  // A program nobody registered has no entitlements at all: refused. A bad user is 38.
  fs::copy_file(KESTRELCTL_BINARY, scratch.resolve("/bin/stranger"));
  EXPECT_EQ(ctl("stranger", {"create", "--class", "2", "--user", "501"}).exitStatus, 4);
  auto badUser = ctl("app-client", {"create", "--class", "Bundle/Application", "--user", "501"});
  EXPECT_EQ(badUser.exitStatus, 1);
  EXPECT_NE(badUser.output.find("error 38"), std::string::npos) << badUser.output;

  // System containers: a well-known one, but not its own without the entitlement.
  auto known = ctl("app-client", {"system-container", "--identifier", "com.zorvane.egretd"});
  ASSERT_EQ(known.exitStatus, 0) << known.output;
  EXPECT_EQ(fact(known.output, "path"),
            scratch.resolve("/private/var/containers/Data/System/com.zorvane.egretd"));
  auto own = ctl("app-client", {"system-container"});
  EXPECT_EQ(own.exitStatus, 1);
  EXPECT_NE(own.output.find("error 55"), std::string::npos) << own.output;
  EXPECT_NE(log().find("com.example.app not entitled for a system container"), std::string::npos);

  // A locked device still gets new containers: class 0 holds no keys that locking takes away.
  scratch.writeFile("/run/kestrel/lock-state", "1\n");
  auto locked = ctl("allowed-client", {"create", "--class", "2", "--user", "501", "--identifier",
                                       "com.example.while-locked"});
  EXPECT_EQ(locked.exitStatus, 0) << locked.output;
  EXPECT_EQ(fact(locked.output, "existed"), "no");
  EXPECT_EQ(daemon.stop(), 0);
}

// What the kernel lets other users do in a system container the daemon made,
// tried with real processes of those users.
TEST_F(ContainerEndToEndTest, SystemContainerIsOpenToItsUsersAsTheKernelEnforcesIt) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  auto made = ctl("app-client", {"system-container", "--identifier", "com.zorvane.egretd"});
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  const std::string c = fact(made.output, "path");
  const std::vector<std::string> member = {"--reuid=499", "--regid=499", "--groups=499"};
  const std::vector<std::string> mobile = {"--reuid=501", "--regid=501", "--clear-groups"};
  struct Row {
    const std::vector<std::string>& who;
    std::string command;
    bool succeeds;
  } rows[] = {
      {member, "ls -A " + c, true},
      {member, "touch " + c + "/made-by-member", true},
      {member, "mkdir " + c + "/dir-by-member", true},
      {member, "mv " + c + "/made-by-member " + c + "/renamed-by-member", true},  // its own
      {member, "touch " + c + "/Library/Caches/inside", true},
      {member, "mv " + c + "/.com.zorvane.kestrel.metadata.plist " + c + "/moved", false},
      {member, "rm -f " + c + "/.com.zorvane.kestrel.metadata.plist", false},
      {member, "mv " + c + "/Library " + c + "/Elsewhere", false},
      {member, "rmdir " + c + "/tmp", false},
      {mobile, "ls " + c + "/Library", false},
      {mobile, "touch " + c + "/made-by-mobile", false},
      {mobile, "mkdir " + c + "/dir-by-mobile", false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.who[0] + " " + row.command);
    std::vector<std::string> arguments = row.who;
    arguments.insert(arguments.end(), {"--", "sh", "-c", row.command});
    const testing::ProcessResult result = testing::runProcess("/usr/bin/setpriv", arguments);
    EXPECT_EQ(result.exitStatus == 0, row.succeeds) << result.output;
  }
  for (const char* kept : {"/.com.zorvane.kestrel.metadata.plist", "/Library", "/tmp"}) {
    EXPECT_TRUE(fs::exists(c + kept)) << kept;
  }
  EXPECT_FALSE(fs::exists(c + "/made-by-mobile"));
  EXPECT_FALSE(fs::exists(c + "/dir-by-mobile"));
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace kestrel
