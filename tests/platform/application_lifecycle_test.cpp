// Holding an application terminated on Linux, with real processes: a
// registered program that goes on SIGTERM, and one that ignores it.
#include "platform/linux/application_lifecycle_linux.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <thread>

#include "platform/linux/code_signing_identity_linux.h"
#include "support/registered_clients.h"

namespace kestrel::platform {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

// How the process ended: the signal that ended it, or -1.
int endingSignal(pid_t pid) {
  int status = 0;
  if (::waitpid(pid, &status, 0) != pid) return -1;
  return WIFSIGNALED(status) ? WTERMSIG(status) : -1;
}

bool runs(pid_t pid, const std::string& executable) {
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (std::chrono::steady_clock::now() < deadline) {
    std::error_code ec;
    if (fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", ec) == executable) return true;
    std::this_thread::sleep_for(10ms);
  }
  return false;
}

TEST(ApplicationLifecycleTest, EndsTheRegisteredProcessesAndHoldsTheIdentityUntilInvalidated) {
  testing::ScratchRoot scratch;
  const std::string sleeper =
      testing::registerProgram(scratch, "sleeper", "com.example.app", "", "/bin/sleep");

  const pid_t polite = testing::spawnProcess(sleeper, {"60"});
  // SIGTERM ignored across the exec: only SIGKILL ends this one.
  const pid_t stubborn =
      testing::spawnProcess("/bin/sh", {"-c", "trap '' TERM; exec " + sleeper + " 61"});
  const pid_t stranger = testing::spawnProcess("/bin/sleep", {"62"});
  ASSERT_TRUE(runs(polite, sleeper) && runs(stubborn, sleeper));

  LinuxApplicationLifecycle lifecycle(std::make_shared<LinuxCodeSigningIdentity>(scratch.root()),
                                      200ms);
  std::promise<TerminationReport> done;
  auto assertion = lifecycle.acquireTerminationAssertion(
      "com.example.app", TerminationReason::Installation,
      [&](const TerminationReport& report) { done.set_value(report); });
  ASSERT_TRUE(assertion);
  EXPECT_TRUE(lifecycle.isHeldTerminated("com.example.app"));
  const TerminationReport report = done.get_future().get();
  EXPECT_FALSE(report.error) << report.description();
  ASSERT_EQ(report.ended.size(), 2u) << report.description();
  for (const auto& ended : report.ended) {
    EXPECT_EQ(ended.killed, ended.pid == stubborn) << ended.pid;
  }
  EXPECT_EQ(endingSignal(polite), SIGTERM);
  EXPECT_EQ(endingSignal(stubborn), SIGKILL);
  EXPECT_EQ(::kill(stranger, 0), 0);  // not of the identity

  assertion->invalidate();
  EXPECT_FALSE(lifecycle.isHeldTerminated("com.example.app"));
  ::kill(stranger, SIGKILL);
  endingSignal(stranger);
}

}  // namespace
}  // namespace kestrel::platform
