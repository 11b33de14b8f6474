// Commands 0, 1 and 15 through the real daemon, from clients of different
// identities and rights.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <signal.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
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
  // The user's own, down to its sub-directories (under the unit, CAP_CHOWN).
  for (const std::string& item : {path, path + "/Library/Preferences"}) {
    struct stat status {};
    ASSERT_EQ(::stat(item.c_str(), &status), 0) << item;
    EXPECT_EQ(status.st_uid, 501u) << item;
    EXPECT_EQ(status.st_gid, 501u) << item;
  }

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

// Commands 8, 22, 9 and 23 on one container: a repair puts back what was
// removed, a new directory UUID moves it where lookups then find it, and its
// usage counts a hard-linked file once, before and after the move.
TEST_F(ContainerEndToEndTest, RepairMoveAndMeasureAContainer) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::vector<std::string> container = {
      "--class", "2", "--user", "501", "--identifier", "com.example.app"};
  const auto run = [&](const std::string& subcommand, bool json = false) {
    std::vector<std::string> arguments;
    if (json) arguments.push_back("--json");
    arguments.push_back(subcommand);
    arguments.insert(arguments.end(), container.begin(), container.end());
    return ctl("allowed-client", arguments);
  };
  auto made = run("create");
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  const std::string path = fact(made.output, "path");
  const std::string uuid = fact(made.output, "uuid");

  std::ofstream(path + "/Documents/data") << std::string(100000, 'x');
  fs::create_hard_link(path + "/Documents/data", path + "/tmp/link");
  struct stat data {
  }, metadata{};
  ASSERT_EQ(::stat((path + "/Documents/data").c_str(), &data), 0);
  ASSERT_EQ(::stat((path + "/.com.zorvane.kestrel.metadata.plist").c_str(), &metadata), 0);
  const std::string expected = std::to_string((data.st_blocks + metadata.st_blocks) * 512);
  auto usage = run("usage");
  ASSERT_EQ(usage.exitStatus, 0) << usage.output;
  EXPECT_EQ(fact(usage.output, "bytes"), expected);
  auto json = run("usage", true);
  EXPECT_NE(json.output.find("\"ReplyDiskUsage\": " + expected), std::string::npos) << json.output;

  struct stat before {};
  ASSERT_EQ(::stat((path + "/Library/Preferences").c_str(), &before), 0);
  for (const char* command : {"8", "22"}) {
    SCOPED_TRACE(command);
    fs::remove(path + "/Library/Preferences");
    auto repaired = call("allowed-client", {command, "ContainerClass=u64:2", "UserID=u64:501",
                                            "Identifier=str:com.example.app", "UUID=uuid:" + uuid});
    EXPECT_EQ(repaired.exitStatus, 0) << repaired.output;
    struct stat after {};
    ASSERT_EQ(::stat((path + "/Library/Preferences").c_str(), &after), 0);
    EXPECT_EQ(after.st_mode, before.st_mode);
    EXPECT_EQ(after.st_uid, before.st_uid);
  }

  auto moved = run("new-uuid");
  ASSERT_EQ(moved.exitStatus, 0) << moved.output;
  auto found = run("lookup");
  ASSERT_EQ(found.exitStatus, 0) << found.output;
  const std::string newPath = fact(found.output, "path");
  EXPECT_EQ(fact(found.output, "uuid"), uuid);
  EXPECT_NE(newPath, path);
  EXPECT_EQ(fs::path(newPath).parent_path(), fs::path(path).parent_path());
  EXPECT_FALSE(fs::exists(path));
  EXPECT_EQ(fs::file_size(newPath + "/tmp/link"), 100000u);
  EXPECT_EQ(fact(run("usage").output, "bytes"), expected);
  EXPECT_EQ(daemon.stop(), 0);
}

// Command 26 moves an item within a system group container, and refuses a
// path that leads out through a link the client made.
TEST_F(ContainerEndToEndTest, StagedContentStaysInItsSystemGroupContainer) {
  registerClient("stager", "com.example.stager",
                 "<key>com.zorvane.private.Kestrel.stageSharedContent</key><true/>"
                 "<key>com.zorvane.security.system-groups</key>"
                 "<array><string>systemgroup.com.example.shared</string></array>");
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  auto made = call("stager", {"17", "GroupIdentifier=str:systemgroup.com.example.shared"});
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  const std::string key = "\"ReplyPath\": \"";
  const std::size_t start = made.output.find(key) + key.size();
  const std::string group = made.output.substr(start, made.output.find('"', start) - start);
  std::ofstream(group + "/item") << "x";
  fs::create_symlink("/etc", group + "/etc");
  const auto stage = [&](const std::string& source, const std::string& dest) {
    return call("stager", {"26", "Identifier=str:systemgroup.com.example.shared",
                           "SourcePath=str:" + source, "DestPath=str:" + dest});
  };
  auto staged = stage("item", "staged");
  EXPECT_EQ(staged.exitStatus, 0) << staged.output << log();
  EXPECT_TRUE(fs::exists(group + "/staged"));
  auto escaped = stage("etc/passwd", "stolen");
  EXPECT_NE(escaped.output.find("\"ReplyError\": 10"), std::string::npos) << escaped.output;
  EXPECT_FALSE(fs::exists(group + "/stolen"));
  EXPECT_EQ(daemon.stop(), 0);
}

// The system calls of one creation, watched from outside with strace: the
// whole container reaches the disk before the rename that makes it live, and
// the class directory after it, before the reply.
TEST_F(ContainerEndToEndTest, CreationIsOnDiskBeforeItIsAcknowledged) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::string trace = scratch.path() + ".strace";
  const pid_t strace = testing::spawnProcess(
      "/usr/bin/strace", {"-f", "-y", "-qq", "-o", trace, "-e", "trace=fsync,rename,mkdir,sendmsg",
                          "-p", std::to_string(daemon.pid())});
  ASSERT_GT(strace, 0);
  ASSERT_TRUE(testing::waitUntilTraced(daemon.pid()));
  auto made = ctl("app-client", {"create", "--class", "2", "--user", "501"});
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  testing::stopProcess(strace, SIGINT);
  const std::string path = fact(made.output, "path");
  const std::string uuid = fs::path(path).filename();
  const std::string classDirectory = fs::path(path).parent_path();

  std::vector<std::string> calls;  // "fsync <path>", "rename <to>", "reply"
  std::ifstream in(trace);
  for (std::string line; std::getline(in, line);) {
    if (const auto at = line.find("fsync("); at != std::string::npos) {
      const auto open = line.find('<', at), close = line.find(">)", at);
      if (open != std::string::npos && close != std::string::npos)
        calls.push_back("fsync " + line.substr(open + 1, close - open - 1));
    } else if (line.find("rename(") != std::string::npos &&
               line.find("\", \"" + path + "\")") != std::string::npos) {
      calls.push_back("rename " + path);
    } else if (line.find("sendmsg(") != std::string::npos &&
               line.find("ReplyError") != std::string::npos) {
      calls.push_back("reply");
    }
  }
  const auto position = [&](const std::string& call) {
    return std::find(calls.begin(), calls.end(), call) - calls.begin();
  };
  const auto renamed = position("rename " + path);
  ASSERT_LT(renamed, static_cast<long>(calls.size())) << trace;
  const std::string staged =
      scratch.resolve("/private/var/root/Library/Caches/com.zorvane.kestreld/Staging/") + uuid;
  for (const char* directory :
       {"/Documents", "/Library/Caches", "/Library/Preferences", "/Library", "/tmp", ""}) {
    EXPECT_LT(position("fsync " + staged + directory), renamed) << directory;
  }
  const auto classSynced = position("fsync " + classDirectory);
  EXPECT_GT(classSynced, renamed);
  EXPECT_LT(classSynced, static_cast<long>(calls.size()));
  EXPECT_GT(std::find(calls.begin() + classSynced, calls.end(), "reply") - calls.begin(),
            classSynced);
  EXPECT_NE(std::find(calls.begin() + classSynced, calls.end(), "reply"), calls.end());
  fs::remove(trace);
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
