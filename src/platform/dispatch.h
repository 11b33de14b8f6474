// Our own small work-queue library.
//
//  - Serial queues run one item at a time, in submission order.
//  - Concurrent queues run their items in parallel on their target pool.
//  - Every queue can be suspended and resumed (counted; an item that already
//    started finishes) and given a target queue before first use: a serial
//    queue drains on its target, so a serial queue targeted at the background
//    pool runs at background priority.
//  - The global pools (default and background priority) grow with demand; the
//    background pool runs its threads at the lowest CPU and idle I/O priority.
//  - The main queue runs on the thread that calls runMainLoop().
//  - sync() runs the item on the calling thread once the queue reaches it, so
//    it never ties up a pool thread while it waits.
#pragma once

#include <functional>
#include <memory>
#include <string>

namespace kestrel::platform {

using Work = std::function<void()>;

enum class QueuePriority { Default, Background };

class DispatchQueue {
 public:
  virtual ~DispatchQueue() = default;

  // nullptr only when the queue cannot be made (no thread could be started).
  static std::shared_ptr<DispatchQueue> createSerial(std::string label);
  static std::shared_ptr<DispatchQueue> createConcurrent(std::string label);
  static std::shared_ptr<DispatchQueue> main();
  static std::shared_ptr<DispatchQueue> global(QueuePriority priority = QueuePriority::Default);

  virtual const std::string& label() const = 0;
  virtual void async(Work work) = 0;
  virtual void sync(Work work) = 0;
  // Counted: the queue runs again once every suspend() has been matched by a resume().
  // A resume() without a matching suspend() is a programming error and aborts.
  virtual void suspend() = 0;
  virtual void resume() = 0;
  // Before the first item is submitted. Aborts on a global queue or the main queue.
  virtual void setTarget(std::shared_ptr<DispatchQueue> target) = 0;
  // True when the calling thread is running an item of this queue (directly or
  // through a queue targeted at it).
  virtual bool isCurrent() const = 0;
};

// Runs the main queue on the calling thread until stopMainLoop() is called.
// Returns the status passed to stopMainLoop().
int runMainLoop();
void stopMainLoop(int status = 0);

// Watches a descriptor for readability; the handler runs on the given queue.
// The handler is not run again until the previous run returned. Sources start
// suspended (call resume(); calling it again does nothing); destroying the
// source stops the watch and waits for a running handler to return, unless
// called from that handler itself.
class ReadSource {
 public:
  virtual ~ReadSource() = default;
  static std::unique_ptr<ReadSource> create(int fd, std::shared_ptr<DispatchQueue> queue,
                                            Work handler);
  virtual void resume() = 0;
};

// Blocks SIGTERM and SIGINT for the process and delivers them to
// the handler on the main queue. Call before any other thread starts.
// The returned source is already resumed.
std::unique_ptr<ReadSource> watchTerminationSignals(std::function<void(int signal)> handler);

}  // namespace kestrel::platform
