#include "support/daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string_view>
#include <thread>

#include "platform/unique_fd.h"

extern char** environ;

namespace kestrel::testing {

namespace {

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (auto& s : strings) result.push_back(s.data());
  result.push_back(nullptr);
  return result;
}

// This process's environment with the extra entries, which replace entries
// of the same name.
std::vector<std::string> environmentWith(const std::vector<std::string>& extra) {
  auto replaced = [&](std::string_view entry) {
    const std::string_view name = entry.substr(0, entry.find('=') + 1);
    for (const auto& e : extra) {
      if (e.starts_with(name)) return true;
    }
    return false;
  };
  std::vector<std::string> env;
  for (char** e = environ; *e != nullptr; ++e) {
    if (!replaced(*e)) env.emplace_back(*e);
  }
  for (const auto& entry : extra) env.push_back(entry);
  return env;
}

// The process listening on a Unix socket, as the kernel recorded it; -1 when
// it cannot be reached.
pid_t listenerOf(const std::string& socketPath) {
  platform::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (!fd || socketPath.size() >= sizeof address.sun_path) return -1;
  std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size());
  if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return -1;
  ucred peer{};
  socklen_t length = sizeof peer;
  if (::getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return -1;
  return peer.pid;
}

}  // namespace

DaemonProcess::DaemonProcess(const std::string& root,
                             const std::vector<std::string>& extraEnvironment) {
  const std::string socket = root + "/run/kestrel/com.zorvane.kestreld";
  ::unlink(socket.c_str());  // left by an earlier run: readiness is the new socket
  const char* wrapper = std::getenv("KESTREL_TEST_DAEMON_WRAPPER");
  std::vector<std::string> args{KESTRELD_BINARY};
  if (wrapper != nullptr && wrapper[0] != '\0') args.insert(args.begin(), wrapper);
  std::vector<std::string> extra = extraEnvironment;
  extra.push_back("KESTREL_ROOT=" + root);
  std::vector<std::string> env = environmentWith(extra);
  auto argv = pointers(args);
  auto envp = pointers(env);
  if (posix_spawn(&pid_, args[0].c_str(), nullptr, nullptr, argv.data(), envp.data()) != 0) {
    pid_ = -1;
    return;
  }
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  struct stat st;
  while (std::chrono::steady_clock::now() < deadline) {
    if (::stat(socket.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
      ready_ = true;
      daemonPid_ = wrapper != nullptr && wrapper[0] != '\0' ? listenerOf(socket) : pid_;
      return;
    }
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
}

DaemonProcess::~DaemonProcess() {
  stop();
}

int DaemonProcess::stop() {
  if (pid_ > 0) ::kill(pid_, SIGTERM);
  return waitForExit();
}

int DaemonProcess::waitForExit() {
  if (pid_ <= 0) return -1;
  int status = 0;
  ::waitpid(pid_, &status, 0);
  pid_ = -1;
  daemonPid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

ProcessResult runProcess(const std::string& program, const std::vector<std::string>& arguments,
                         const std::vector<std::string>& extraEnvironment) {
  ProcessResult result;
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return result;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDERR_FILENO);
  std::vector<std::string> args{program};
  args.insert(args.end(), arguments.begin(), arguments.end());
  std::vector<std::string> env = environmentWith(extraEnvironment);
  auto argv = pointers(args);
  auto envp = pointers(env);
  const int spawned =
      posix_spawn(&result.pid, program.c_str(), &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  ::close(fds[1]);
  if (spawned == 0) {
    char buffer[4096];
    ssize_t n;
    while ((n = ::read(fds[0], buffer, sizeof buffer)) > 0) result.output.append(buffer, size_t(n));
    int status = 0;
    ::waitpid(result.pid, &status, 0);
    result.exitStatus = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  ::close(fds[0]);
  return result;
}

pid_t spawnProcess(const std::string& program, const std::vector<std::string>& arguments) {
  std::vector<std::string> args{program};
  args.insert(args.end(), arguments.begin(), arguments.end());
  auto argv = pointers(args);
  pid_t pid = -1;
  if (posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv.data(), environ) != 0) return -1;
  return pid;
}

int stopProcess(pid_t pid, int signal) {
  ::kill(pid, signal);
  int status = 0;
  ::waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

bool waitUntilTraced(pid_t pid) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  const std::string tasks = "/proc/" + std::to_string(pid) + "/task";
  while (std::chrono::steady_clock::now() < deadline) {
    bool all = true;
    std::error_code ec;
    for (const auto& task : std::filesystem::directory_iterator(tasks, ec)) {
      std::ifstream status(task.path() / "status");
      std::string line;
      bool traced = false;
      while (std::getline(status, line)) {
        if (line.starts_with("TracerPid:")) traced = std::stol(line.substr(10)) != 0;
      }
      all = all && traced;
    }
    if (!ec && all) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

}  // namespace kestrel::testing
