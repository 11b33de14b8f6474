// The real daemon binary running on a scratch root, stopped with SIGTERM when
// the owner goes; and client processes run to completion.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace kestrel::testing {

class DaemonProcess {
 public:
  // Starts kestreld with KESTREL_ROOT=root (and the extra environment entries)
  // and waits until its request socket exists. When KESTREL_TEST_DAEMON_WRAPPER
  // names a program, that program is started with the daemon's path as its
  // argument instead, so that it runs the daemon confined as the unit
  // confines it (tools/confined-daemon.sh).
  explicit DaemonProcess(const std::string& root,
                         const std::vector<std::string>& extraEnvironment = {});
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  // The daemon's process (not the wrapper's, when there is one).
  pid_t pid() const { return daemonPid_; }
  bool ready() const { return ready_; }
  // Sends SIGTERM and returns the exit status (or -1).
  int stop();
  // Waits until the daemon ends by itself; its exit status (or -1).
  int waitForExit();

 private:
  pid_t pid_ = -1;  // the process started: the daemon or its wrapper
  pid_t daemonPid_ = -1;
  bool ready_ = false;
};

struct ProcessResult {
  int exitStatus = -1;
  std::string output;  // standard output and error together
  pid_t pid = -1;      // the process it ran as
};

// Runs the program with the arguments and environment entries added to this process's.
ProcessResult runProcess(const std::string& program, const std::vector<std::string>& arguments,
                         const std::vector<std::string>& extraEnvironment = {});

// Starts the program with the arguments and does not wait for it; -1 on failure.
pid_t spawnProcess(const std::string& program, const std::vector<std::string>& arguments);
// Sends the signal and waits for the process; its exit status, or -1.
int stopProcess(pid_t pid, int signal);
// Waits until every thread of the process has a tracer (strace -p attached).
bool waitUntilTraced(pid_t pid);

}  // namespace kestrel::testing
