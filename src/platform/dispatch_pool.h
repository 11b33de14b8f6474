// Internals of the work-queue library: the elastic worker pools behind the
// global queues, and the small helpers the queues and sources share.
#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "platform/dispatch.h"

namespace kestrel::platform::dispatch_detail {

// Prints "kestrel dispatch: <message>" to stderr and aborts. For misuse of the
// library that cannot be recovered from.
[[noreturn]] void fail(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Runs one work item. A work item that throws is a programming error: the
// process aborts with the queue's label and the exception's message.
void runItem(const std::string& label, const Work& work);

// A process-lifetime object: constructed on first use, never destroyed, so
// worker threads that are still running while the process exits never see it
// torn down.
template <typename T>
class Immortal {
 public:
  template <typename... Args>
  explicit Immortal(Args&&... args) {
    std::construct_at(&value_, std::forward<Args>(args)...);
  }
  ~Immortal() {}
  Immortal(const Immortal&) = delete;
  Immortal& operator=(const Immortal&) = delete;

  T& get() { return value_; }

 private:
  union {
    T value_;
  };
};

// Starts a thread with SIGTERM and SIGINT blocked, whatever the caller's mask:
// termination signals are only ever taken through the signal watcher.
std::thread startThread(std::function<void()> body);

// Marks the calling thread as one of ours, named `name`. Only such threads are
// renamed after the queue whose items they run.
void adoptWorkerThread(const char* name);

// While alive, the calling worker thread carries the given label as its name
// (truncated to what the kernel keeps). Does nothing on threads that are not
// ours, such as the main thread or a thread calling sync().
class ThreadNameScope {
 public:
  explicit ThreadNameScope(const std::string& label);
  ~ThreadNameScope();
  ThreadNameScope(const ThreadNameScope&) = delete;
  ThreadNameScope& operator=(const ThreadNameScope&) = delete;

 private:
  bool renamed_ = false;
  std::string previous_;
};

// An elastic pool of worker threads. A thread is started when an item arrives
// and no thread is idle, up to a limit; a thread idle for a few seconds exits.
class WorkerPool {
 public:
  explicit WorkerPool(QueuePriority priority);
  WorkerPool(const WorkerPool&) = delete;
  WorkerPool& operator=(const WorkerPool&) = delete;

  void submit(Work work);

  static constexpr std::size_t kMaxThreads = 64;

 private:
  using ThreadList = std::list<std::thread>;

  void workerLoop(ThreadList::iterator self);
  // Called with mutex_ held; returns false when no thread could be started.
  bool spawnLocked();

  const QueuePriority priority_;
  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<Work> items_;
  ThreadList threads_;
  // A thread that exited leaves its handle here; the next exit or spawn joins it.
  std::thread finished_;
  std::size_t idle_ = 0;
};

}  // namespace kestrel::platform::dispatch_detail
