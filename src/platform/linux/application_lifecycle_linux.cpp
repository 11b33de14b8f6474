#include "platform/linux/application_lifecycle_linux.h"

#include <dirent.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <charconv>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/dispatch.h"
#include "platform/peer_credentials.h"

namespace kestrel::platform {

namespace {

// How long a process may take to go once it was sent SIGKILL (it may be in
// the middle of a system call that cannot be interrupted).
constexpr std::chrono::milliseconds kKillWait{5000};

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};

struct Target {
  pid_t pid;
  std::shared_ptr<UniqueFd> pidfd;
  bool killed = false;
  bool ended = false;
};

std::string errorText(int error) {
  return std::generic_category().message(error);
}

// The pids of /proc, without this process; false when it cannot be listed.
bool listProcesses(std::vector<pid_t>* pids) {
  const std::unique_ptr<DIR, DirCloser> proc(::opendir("/proc"));
  if (!proc) return false;
  const pid_t self = ::getpid();
  while (const dirent* entry = ::readdir(proc.get())) {
    const std::string_view name(entry->d_name);
    pid_t pid = 0;
    const auto [end, ec] = std::from_chars(name.data(), name.data() + name.size(), pid);
    if (ec == std::errc() && end == name.data() + name.size() && pid > 0 && pid != self) {
      pids->push_back(pid);
    }
  }
  return true;
}

// Sends the signal to every target that has not ended; a target that is
// already gone counts as ended. False, with the error, when one could not
// be signalled.
bool signalTargets(std::vector<Target>& targets, int signal, std::string* error) {
  bool sent = true;
  for (Target& target : targets) {
    if (target.ended) continue;
    if (::syscall(SYS_pidfd_send_signal, target.pidfd->get(), signal, nullptr, 0) == 0) {
      target.killed = signal == SIGKILL;
      continue;
    }
    if (errno == ESRCH) {
      target.ended = true;
      continue;
    }
    *error = "cannot send signal " + std::to_string(signal) + " to pid " +
             std::to_string(target.pid) + ": " + errorText(errno);
    sent = false;
  }
  return sent;
}

// Waits until every target ended (its pidfd becomes readable) or the time is up.
void waitForTargets(std::vector<Target>& targets, std::chrono::milliseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  for (;;) {
    std::vector<pollfd> fds;
    std::vector<Target*> waiting;
    for (Target& target : targets) {
      if (target.ended) continue;
      fds.push_back(pollfd{target.pidfd->get(), POLLIN, 0});
      waiting.push_back(&target);
    }
    if (fds.empty()) return;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return;
    const int ready = ::poll(fds.data(), fds.size(), static_cast<int>(left.count()));
    if (ready < 0 && errno != EINTR) return;
    for (std::size_t i = 0; i < fds.size(); ++i) {
      if (fds[i].revents != 0) waiting[i]->ended = true;
    }
  }
}

class LinuxTerminationAssertion final : public TerminationAssertion {
 public:
  LinuxTerminationAssertion(std::shared_ptr<LinuxApplicationLifecycle::Holds> holds,
                            std::string identifier)
      : holds_(std::move(holds)), identifier_(std::move(identifier)) {}
  // An assertion that goes without being invalidated holds nothing any more.
  ~LinuxTerminationAssertion() override { invalidate(); }

  void invalidate() override {
    if (invalidated_.exchange(true)) return;
    const std::lock_guard lock(holds_->mutex);
    const auto found = holds_->counts.find(identifier_);
    if (found != holds_->counts.end() && --found->second == 0) holds_->counts.erase(found);
  }

 private:
  const std::shared_ptr<LinuxApplicationLifecycle::Holds> holds_;
  const std::string identifier_;
  std::atomic<bool> invalidated_{false};
};

}  // namespace

TerminationReport endProcessesOfIdentity(CodeSigningIdentity& identity,
                                         const std::string& signingIdentifier,
                                         std::chrono::milliseconds gracePeriod) {
  TerminationReport report;
  std::vector<pid_t> pids;
  if (!listProcesses(&pids)) {
    report.error = "cannot list the processes in /proc: " + errorText(errno);
    return report;
  }
  std::vector<Target> targets;
  for (const pid_t pid : pids) {
    PeerCredentials process = readProcessCredentials(pid);
    if (!process.pidfd) continue;  // gone meanwhile
    if (identity.identify(process).signingIdentifier != signingIdentifier) continue;
    targets.push_back(Target{pid, process.pidfd});
  }

  std::string error;
  if (signalTargets(targets, SIGTERM, &error)) {
    waitForTargets(targets, gracePeriod);
    if (signalTargets(targets, SIGKILL, &error)) waitForTargets(targets, kKillWait);
  }
  for (const Target& target : targets) {
    if (target.ended) {
      report.ended.push_back({target.pid, target.killed});
    } else if (error.empty()) {
      error = "pid " + std::to_string(target.pid) + " did not end";
    }
  }
  if (!error.empty()) report.error = std::move(error);
  return report;
}

LinuxApplicationLifecycle::LinuxApplicationLifecycle(std::shared_ptr<CodeSigningIdentity> identity,
                                                     std::chrono::milliseconds gracePeriod)
    : identity_(std::move(identity)),
      gracePeriod_(gracePeriod),
      holds_(std::make_shared<Holds>()) {}

std::shared_ptr<TerminationAssertion> LinuxApplicationLifecycle::acquireTerminationAssertion(
    const std::string& signingIdentifier, TerminationReason,
    std::function<void(const TerminationReport& report)> completion) {
  if (!identity_ || signingIdentifier.empty()) return nullptr;
  const std::shared_ptr<DispatchQueue> pool = DispatchQueue::global();
  if (!pool) return nullptr;
  {
    const std::lock_guard lock(holds_->mutex);
    ++holds_->counts[signingIdentifier];
  }
  auto assertion = std::make_shared<LinuxTerminationAssertion>(holds_, signingIdentifier);
  pool->async([identity = identity_, signingIdentifier, grace = gracePeriod_,
               completion = std::move(completion)] {
    const TerminationReport report = endProcessesOfIdentity(*identity, signingIdentifier, grace);
    if (completion) completion(report);
  });
  return assertion;
}

bool LinuxApplicationLifecycle::isHeldTerminated(const std::string& signingIdentifier) {
  const std::lock_guard lock(holds_->mutex);
  return holds_->counts.count(signingIdentifier) > 0;
}

}  // namespace kestrel::platform
