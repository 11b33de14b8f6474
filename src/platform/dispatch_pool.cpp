#include "platform/dispatch_pool.h"

#include <linux/ioprio.h>
#include <pthread.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <system_error>
#include <typeinfo>

namespace kestrel::platform::dispatch_detail {

namespace {

constexpr auto kIdleTimeout = std::chrono::seconds(5);
// The kernel keeps 15 characters of a thread's name.
constexpr std::size_t kThreadNameMax = 15;

// The CPU and I/O priority the process started with, taken on the main thread
// before main() runs. A default-priority worker started from a background
// worker would otherwise inherit the background worker's priority.
struct BasePriority {
  int nice = 0;
  int ioprio = -1;
  BasePriority() {
    errno = 0;
    int value = getpriority(PRIO_PROCESS, 0);
    if (errno == 0) nice = value;
    ioprio = static_cast<int>(syscall(SYS_ioprio_get, IOPRIO_WHO_PROCESS, 0));
  }
};
const BasePriority kBasePriority;

pid_t currentTid() {
  return static_cast<pid_t>(syscall(SYS_gettid));
}

void applyPriority(QueuePriority priority) {
  const pid_t tid = currentTid();
  if (priority == QueuePriority::Background) {
    setpriority(PRIO_PROCESS, static_cast<id_t>(tid), 19);
    syscall(SYS_ioprio_set, IOPRIO_WHO_PROCESS, tid, IOPRIO_PRIO_VALUE(IOPRIO_CLASS_IDLE, 0));
    return;
  }
  // Raising the priority back needs privilege; without it the thread keeps
  // what it inherited, which is the best we can do.
  errno = 0;
  int nice = getpriority(PRIO_PROCESS, static_cast<id_t>(tid));
  if (errno == 0 && nice != kBasePriority.nice) {
    setpriority(PRIO_PROCESS, static_cast<id_t>(tid), kBasePriority.nice);
  }
  if (kBasePriority.ioprio >= 0 &&
      syscall(SYS_ioprio_get, IOPRIO_WHO_PROCESS, tid) != kBasePriority.ioprio) {
    syscall(SYS_ioprio_set, IOPRIO_WHO_PROCESS, tid, kBasePriority.ioprio);
  }
}

thread_local bool tWorkerThread = false;
// The name the calling worker thread carries now.
thread_local std::string tThreadName;

void setCurrentThreadName(const std::string& name) {
  std::string shortName = name.substr(0, kThreadNameMax);
  if (shortName == tThreadName) return;
  pthread_setname_np(pthread_self(), shortName.c_str());
  tThreadName = std::move(shortName);
}

}  // namespace

void fail(const char* format, ...) {
  std::fputs("kestrel dispatch: ", stderr);
  va_list args;
  va_start(args, format);
  std::vfprintf(stderr, format, args);
  va_end(args);
  std::fputc('\n', stderr);
  std::fflush(stderr);
  std::abort();
}

void runItem(const std::string& label, const Work& work) {
  try {
    work();
  } catch (const std::exception& e) {
    fail("a work item on queue '%s' threw %s: %s", label.c_str(), typeid(e).name(), e.what());
  } catch (...) {
    fail("a work item on queue '%s' threw a non-standard exception", label.c_str());
  }
}

std::thread startThread(std::function<void()> body) {
  sigset_t termination;
  sigemptyset(&termination);
  sigaddset(&termination, SIGTERM);
  sigaddset(&termination, SIGINT);
  sigset_t previous;
  pthread_sigmask(SIG_BLOCK, &termination, &previous);
  std::thread thread;
  std::exception_ptr error;
  try {
    thread = std::thread(std::move(body));
  } catch (...) {
    error = std::current_exception();
  }
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  if (error) std::rethrow_exception(error);
  return thread;
}

void adoptWorkerThread(const char* name) {
  tWorkerThread = true;
  setCurrentThreadName(name);
}

ThreadNameScope::ThreadNameScope(const std::string& label) {
  if (!tWorkerThread) return;
  previous_ = tThreadName;
  setCurrentThreadName(label);
  renamed_ = true;
}

ThreadNameScope::~ThreadNameScope() {
  if (renamed_) setCurrentThreadName(previous_);
}

WorkerPool::WorkerPool(QueuePriority priority) : priority_(priority) {}

void WorkerPool::submit(Work work) {
  std::thread reaped;
  {
    std::lock_guard lock(mutex_);
    items_.push_back(std::move(work));
    // Idle threads take queued items one each; start another thread only when
    // the queue holds more items than there are idle threads to take them.
    if (items_.size() <= idle_) {
      wake_.notify_one();
    } else {
      if (idle_ > 0) wake_.notify_one();
      if (threads_.size() < kMaxThreads && !spawnLocked() && threads_.empty()) {
        fail("no worker thread could be started for the %s pool",
             priority_ == QueuePriority::Background ? "background" : "default");
      }
    }
    reaped = std::move(finished_);
  }
  if (reaped.joinable()) reaped.join();
}

bool WorkerPool::spawnLocked() {
  threads_.emplace_back();
  auto self = std::prev(threads_.end());
  try {
    // The new thread blocks on mutex_ (held here) before it looks at `self`.
    *self = startThread([this, self] { workerLoop(self); });
  } catch (const std::system_error&) {
    threads_.erase(self);
    return false;
  }
  return true;
}

void WorkerPool::workerLoop(ThreadList::iterator self) {
  applyPriority(priority_);
  adoptWorkerThread(priority_ == QueuePriority::Background ? "kst.bg" : "kst.pool");

  std::unique_lock lock(mutex_);
  for (;;) {
    if (!items_.empty()) {
      Work work = std::move(items_.front());
      items_.pop_front();
      lock.unlock();
      work();
      // Drop whatever the item captured before taking the lock again.
      work = nullptr;
      lock.lock();
      continue;
    }
    ++idle_;
    bool woken = wake_.wait_for(lock, kIdleTimeout, [this] { return !items_.empty(); });
    --idle_;
    if (!woken) break;
  }
  // Idle for long enough: leave. This thread's handle is parked in finished_
  // for someone else to join; the handle parked before is joined here.
  std::thread previous = std::move(finished_);
  finished_ = std::move(*self);
  threads_.erase(self);
  lock.unlock();
  if (previous.joinable()) previous.join();
}

}  // namespace kestrel::platform::dispatch_detail
