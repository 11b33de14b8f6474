// Command 21 through the real daemon on a locked device: the lock-state file,
// the reply that waits for the unlock, and the app's process ended meanwhile
// and served again afterwards.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <fstream>
#include <future>
#include <thread>

#include "support/registered_clients.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

using namespace std::chrono_literals;

class DataProtectionEndToEndTest : public testing::RegisteredClientsTest {
 protected:
  DataProtectionEndToEndTest() {
    // The app: a kestrelctl that asks for its own container, and a program
    // that just runs; both sign as com.example.app.
    registerClient("app-client", "com.example.app",
                   "<key>com.zorvane.private.Kestrel.none</key><true/>");
    testing::registerProgram(scratch, "app", "com.example.app", "", "/bin/sleep");
  }

  testing::ProcessResult protect(const char* protectionClass, bool retry) {
    std::vector<std::string> arguments{"set-protection-class",
                                       "--class",
                                       "2",
                                       "--user",
                                       "501",
                                       "--identifier",
                                       "com.example.app",
                                       "--protection-class",
                                       protectionClass};
    if (retry) arguments.push_back("--retry-if-locked");
    return ctl("allowed-client", arguments);
  }
};

TEST_F(DataProtectionEndToEndTest, ALockedDeviceGetsItsAnswerAfterTheUnlockWithTheAppEnded) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  auto made = ctl("app-client", {"--json", "create", "--class", "2", "--user", "501"});
  ASSERT_EQ(made.exitStatus, 0) << made.output;
  const std::size_t at = made.output.find("\"ReplyPath\": \"") + 14;
  const std::string document =
      made.output.substr(at, made.output.find('"', at) - at) + "/Documents/notes";
  std::ofstream(document) << "the app's";

  const pid_t app = testing::spawnProcess(scratch.resolve("/bin/app"), {"60"});
  scratch.writeFile("/run/kestrel/lock-state", "1\n");
  const auto refused = protect("1", false);
  EXPECT_EQ(refused.exitStatus, 1);
  EXPECT_NE(refused.output.find("error 61"), std::string::npos) << refused.output;

  auto waiting = std::async(std::launch::async, [this] { return protect("1", true); });
  EXPECT_EQ(waiting.wait_for(500ms), std::future_status::timeout);
  scratch.writeFile("/run/kestrel/lock-state", "0\n");
  ASSERT_EQ(waiting.wait_for(30s), std::future_status::ready);
  const auto answered = waiting.get();
  EXPECT_EQ(answered.exitStatus, 0) << answered.output;
  EXPECT_EQ(testing::protectionClassOf(document), 1);

  int status = 0;
  ASSERT_EQ(::waitpid(app, &status, 0), app);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGTERM) << status;
  EXPECT_NE(log().find("Holding com.example.app terminated: ended 1 process (pid " +
                       std::to_string(app) + ")"),
            std::string::npos)
      << log();
  // No longer held: the app is served again.
  auto again = ctl("app-client", {"lookup", "--class", "2", "--user", "501"});
  EXPECT_EQ(again.exitStatus, 0) << again.output;
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace kestrel
