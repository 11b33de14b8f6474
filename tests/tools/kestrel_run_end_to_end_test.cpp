// kestrel-run through the real daemon: programs started inside their
// containers by bubblewrap, as user 501, seeing their own containers only.
#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "support/registered_clients.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class KestrelRunEndToEndTest : public testing::RegisteredClientsTest {
 protected:
  // kestrel-run ... -- /bin/sh -c script, as the app given, in group.example.shared.
  testing::ProcessResult run(const std::string& app, const std::string& script,
                             std::vector<std::string> extra = {}) {
    std::vector<std::string> arguments = {"--root", scratch.path(), "--identifier",
                                          app,      "--user",       "501"};
    arguments.insert(arguments.end(), extra.begin(), extra.end());
    arguments.insert(arguments.end(), {"--", "/bin/sh", "-c", script});
    return testing::runProcess(KESTREL_RUN_BINARY, arguments);
  }
};

TEST_F(KestrelRunEndToEndTest, ProgramsKeepTheirFilesAndSeeOnlyTheirContainers) {
  if (!fs::exists("/usr/bin/bwrap")) GTEST_SKIP() << "bubblewrap is not installed";
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::vector<std::string> shared = {"--group", "group.example.shared"};

  // The first run makes the app's containers; what it keeps is there the next time.
  auto first = run("com.example.notes",
                   "id -u; echo kept > \"$HOME/Documents/note\"; echo \"$HOME\";"
                   "for g in \"$(dirname \"$HOME\")\"/../../Shared/AppGroup/*; do echo group > "
                   "$g/from-notes; done;"
                   "touch /usr/escaped \"$TMPDIR/scratch\" /tmp/private",
                   shared);
  EXPECT_EQ(first.exitStatus, 1) << first.output;  // /usr/escaped is refused
  EXPECT_EQ(first.output.rfind("501\n", 0), 0u) << first.output;
  EXPECT_NE(first.output.find("/usr/escaped': Read-only file system"), std::string::npos)
      << first.output;
  const std::string notesHome = first.output.substr(4, first.output.find('\n', 4) - 4);
  ASSERT_TRUE(fs::exists(notesHome + "/Documents/note")) << first.output;
  EXPECT_TRUE(fs::exists(notesHome + "/tmp/scratch"));
  EXPECT_FALSE(fs::exists("/usr/escaped"));
  EXPECT_EQ(run("com.example.notes", "cat \"$HOME/Documents/note\"", shared).output, "kept\n");

  // Another app of the group: the group's file, but not the first app's container,
  // nor anything else of the store, nor a way to write beside it.
  const std::string store = scratch.resolve("/private/var");
  auto other = run("com.example.reader",
                   "cat \"$(dirname \"$HOME\")/../../Shared/AppGroup\"/*/from-notes;"
                   "ls '" +
                       notesHome +
                       "' 2>/dev/null || echo no-notes;"
                       "ls '" +
                       store +
                       "/containers' 2>/dev/null || echo no-system-store;"
                       "touch '" +
                       store + "/planted' 2>/dev/null || echo read-only",
                   shared);
  EXPECT_EQ(other.exitStatus, 0) << other.output;
  EXPECT_EQ(other.output, "group\nno-notes\nno-system-store\nread-only\n");
  EXPECT_FALSE(fs::exists(store + "/planted"));

  // A reply without every container starts nothing.
  auto refused = run("com.example.notes", "touch /tmp/started", {"--group", "bad/group"});
  EXPECT_EQ(refused.exitStatus, 4) << refused.output;
  EXPECT_NE(refused.output.find("nothing started"), std::string::npos) << refused.output;
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace kestrel
