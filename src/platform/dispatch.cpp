#include "platform/dispatch.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <deque>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/dispatch_pool.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

using dispatch_detail::fail;
using dispatch_detail::Immortal;
using dispatch_detail::runItem;
using dispatch_detail::ThreadNameScope;

class QueueImpl;

// The queues whose items the calling thread is running, innermost last. A
// serial queue draining on its target sits above the target.
thread_local std::vector<const QueueImpl*> tRunning;

bool isRunning(const QueueImpl* queue) {
  return std::find(tRunning.begin(), tRunning.end(), queue) != tRunning.end();
}

class RunningScope {
 public:
  explicit RunningScope(const QueueImpl* queue) { tRunning.push_back(queue); }
  ~RunningScope() { tRunning.pop_back(); }
  RunningScope(const RunningScope&) = delete;
  RunningScope& operator=(const RunningScope&) = delete;
};

// Marks queues as running on the calling thread until the scope ends.
class RunningStack {
 public:
  RunningStack() = default;
  ~RunningStack() { tRunning.resize(tRunning.size() - count_); }
  RunningStack(const RunningStack&) = delete;
  RunningStack& operator=(const RunningStack&) = delete;

  void push(const QueueImpl* queue) {
    tRunning.push_back(queue);
    ++count_;
  }

 private:
  std::size_t count_ = 0;
};

class QueueImpl : public DispatchQueue, public std::enable_shared_from_this<QueueImpl> {
 public:
  explicit QueueImpl(std::string label) : label_(std::move(label)) {}

  const std::string& label() const override { return label_; }
  bool isCurrent() const override { return isRunning(this); }
  void sync(Work work) override;

  // The queue this one runs its items on; nullptr for the global queues and
  // the main queue, which run on threads of their own.
  virtual std::shared_ptr<QueueImpl> parent() const = 0;
  // Runs one item at a time: serial queues and the main queue.
  virtual bool exclusive() const = 0;
  // Blocks until the calling thread may run a sync() item on this queue, and
  // keeps the queue from running anything else until releaseAfterSync().
  // `drainHere`: the queue's own drain cannot start before the caller returns
  // (it would run inside a queue the caller is running), so the caller runs
  // the items ahead of its own.
  virtual void acquireForSync(bool drainHere) = 0;
  virtual void releaseAfterSync() = 0;

 private:
  const std::string label_;
};

// True when the queue's drain depends on a one-at-a-time queue that the
// calling thread is running right now.
bool drainBlockedByCaller(const QueueImpl& queue) {
  for (auto ancestor = queue.parent(); ancestor; ancestor = ancestor->parent()) {
    if (ancestor->exclusive() && isRunning(ancestor.get())) return true;
  }
  return false;
}

void QueueImpl::sync(Work work) {
  if (exclusive() && isRunning(this)) {
    fail("sync() on queue '%s' from one of its own items would deadlock", label_.c_str());
  }
  // The queue and whatever it runs on, up to the first queue the calling
  // thread is already running (that one and its own targets are held).
  std::vector<std::shared_ptr<QueueImpl>> chain;
  for (auto queue = shared_from_this(); queue && !isRunning(queue.get()); queue = queue->parent()) {
    chain.push_back(queue);
  }
  // Taken outermost first, the order in which drains take them too, so that a
  // sync() never waits for a queue that is waiting for it. Once the calling
  // thread holds a target, the queues below it cannot drain anywhere else and
  // are drained up to the caller's turn right here.
  {
    RunningStack running;
    for (auto it = chain.rbegin(); it != chain.rend(); ++it) {
      (*it)->acquireForSync(drainBlockedByCaller(**it));
      running.push(it->get());
    }
    runItem(label_, work);
  }
  for (auto& queue : chain) queue->releaseAfterSync();
}

std::shared_ptr<QueueImpl> globalImpl(QueuePriority priority);

std::shared_ptr<QueueImpl> asTarget(const std::string& label,
                                    std::shared_ptr<DispatchQueue> target) {
  if (!target) return globalImpl(QueuePriority::Default);
  auto impl = std::dynamic_pointer_cast<QueueImpl>(std::move(target));
  if (!impl) fail("the target of queue '%s' is not a queue of this library", label.c_str());
  return impl;
}

void checkNoCycle(const QueueImpl& queue, const std::shared_ptr<QueueImpl>& target) {
  for (auto ancestor = target; ancestor; ancestor = ancestor->parent()) {
    if (ancestor.get() == &queue) {
      fail("setTarget() would make queue '%s' run on itself", queue.label().c_str());
    }
  }
}

// ---------------------------------------------------------------------------
// Serial queues.
//
// A serial queue is Idle (nothing to do, or suspended), Scheduled (a drain has
// been submitted to the target) or Running (a drain, or a sync() caller, owns
// it). A drain that finds the queue anything but Scheduled is a leftover and
// returns at once, which lets a sync() caller take a Scheduled queue over.

// What serial and concurrent queues share: a target that may be changed
// until the first item is submitted, guarded by the queue's mutex.
class TargetedQueue : public QueueImpl {
 public:
  TargetedQueue(std::string label, std::shared_ptr<QueueImpl> target)
      : QueueImpl(std::move(label)), target_(std::move(target)) {}

  void setTarget(std::shared_ptr<DispatchQueue> target) override {
    auto impl = asTarget(label(), std::move(target));
    checkNoCycle(*this, impl);
    std::lock_guard lock(mutex_);
    if (used_) fail("setTarget() on queue '%s' after items were submitted", label().c_str());
    target_ = std::move(impl);
  }

  std::shared_ptr<QueueImpl> parent() const override {
    std::lock_guard lock(mutex_);
    return target_;
  }

 protected:
  mutable std::mutex mutex_;
  bool used_ = false;  // an item was submitted: the target is fixed
  std::shared_ptr<QueueImpl> target_;
};

class SerialQueue : public TargetedQueue {
 public:
  SerialQueue(std::string label, std::shared_ptr<QueueImpl> target)
      : TargetedQueue(std::move(label), std::move(target)) {}

  void async(Work work) override {
    std::unique_lock lock(mutex_);
    used_ = true;
    items_.push_back({std::move(work), nullptr});
    if (!startLocked()) return;
    lock.unlock();
    scheduleDrain();
  }

  void suspend() override {
    std::lock_guard lock(mutex_);
    ++suspended_;
  }

  void resume() override {
    std::unique_lock lock(mutex_);
    if (suspended_ == 0)
      fail("resume() on queue '%s' without a matching suspend()", label().c_str());
    if (--suspended_ > 0) return;
    notifyLocked();
    if (!startLocked()) return;
    lock.unlock();
    scheduleDrain();
  }

  bool exclusive() const override { return true; }

  void acquireForSync(bool drainHere) override {
    std::unique_lock lock(mutex_);
    used_ = true;
    if (state_ == State::Idle && suspended_ == 0 && items_.empty()) {
      state_ = State::Running;
      return;
    }
    SyncWaiter waiter;
    items_.push_back({nullptr, &waiter});
    ++waiters_;
    if (drainHere) {
      drainHereUntil(lock, waiter);
    } else {
      if (startLocked()) {
        lock.unlock();
        scheduleDrain();
        lock.lock();
      }
      changed_.wait(lock, [&] { return waiter.granted; });
    }
    --waiters_;
  }

  void releaseAfterSync() override {
    std::unique_lock lock(mutex_);
    if (!releaseLocked()) return;
    lock.unlock();
    scheduleDrain();
  }

  // Runs the queue's items until it is empty or suspended, or until a sync()
  // caller's turn comes: then the caller owns the queue and the drain ends.
  void drain() {
    std::unique_lock lock(mutex_);
    if (state_ != State::Scheduled) return;
    state_ = State::Running;
    RunningScope running(this);
    ThreadNameScope name(label());
    for (;;) {
      if (suspended_ > 0 || items_.empty()) {
        state_ = State::Idle;
        notifyLocked();
        return;
      }
      if (items_.front().waiter != nullptr) {
        grantFrontLocked();
        return;
      }
      if (shouldYield()) {
        state_ = State::Scheduled;
        lock.unlock();
        scheduleDrain();
        return;
      }
      Work work = std::move(items_.front().work);
      items_.pop_front();
      lock.unlock();
      runItem(label(), work);
      work = nullptr;
      lock.lock();
    }
  }

 protected:
  // Arranges for drain() to run once.
  virtual void scheduleDrain() {
    auto target = parent();
    target->async(
        [self = std::static_pointer_cast<SerialQueue>(shared_from_this())] { self->drain(); });
  }

  // Asked between items: true to stop the drain here and carry on later.
  virtual bool shouldYield() const { return false; }

 private:
  enum class State { Idle, Scheduled, Running };
  struct SyncWaiter {
    bool granted = false;
  };
  // A work item, or the place of a sync() caller in the line.
  struct Item {
    Work work;
    SyncWaiter* waiter;
  };

  // With mutex_ held: moves an Idle queue with runnable items to Scheduled.
  // True when the caller must then call scheduleDrain() (without the lock).
  bool startLocked() {
    if (state_ != State::Idle || suspended_ > 0 || items_.empty()) return false;
    state_ = State::Scheduled;
    notifyLocked();
    return true;
  }

  // With mutex_ held, by the owner giving the queue up. True when the caller
  // must then call scheduleDrain() (without the lock).
  bool releaseLocked() {
    if (suspended_ == 0 && !items_.empty()) {
      if (items_.front().waiter != nullptr) {
        grantFrontLocked();
        return false;
      }
      state_ = State::Scheduled;
      notifyLocked();
      return true;
    }
    state_ = State::Idle;
    notifyLocked();
    return false;
  }

  // With mutex_ held: hands the queue (Running) to the sync() caller at the front.
  void grantFrontLocked() {
    items_.front().waiter->granted = true;
    items_.pop_front();
    changed_.notify_all();
  }

  void notifyLocked() {
    if (waiters_ > 0) changed_.notify_all();
  }

  // The sync() caller's side when the drain cannot run before it returns: take
  // the queue whenever nobody else owns it and run the items ahead of ours.
  void drainHereUntil(std::unique_lock<std::mutex>& lock, SyncWaiter& waiter) {
    for (;;) {
      changed_.wait(
          lock, [&] { return waiter.granted || (suspended_ == 0 && state_ != State::Running); });
      if (waiter.granted) return;
      state_ = State::Running;
      RunningScope running(this);
      bool handedOn = false;
      while (suspended_ == 0) {
        // Our own place is still in the line, so it is not empty.
        Item item = std::move(items_.front());
        items_.pop_front();
        if (item.waiter == &waiter) return;
        if (item.waiter != nullptr) {
          // Another sync() caller is ahead of us: its turn, then ours.
          item.waiter->granted = true;
          changed_.notify_all();
          handedOn = true;
          break;
        }
        lock.unlock();
        runItem(label(), item.work);
        item.work = nullptr;
        lock.lock();
      }
      if (!handedOn) {
        state_ = State::Idle;
        notifyLocked();
      }
    }
  }

  std::condition_variable changed_;
  std::deque<Item> items_;
  State state_ = State::Idle;
  unsigned suspended_ = 0;
  unsigned waiters_ = 0;
};

// ---------------------------------------------------------------------------
// Concurrent queues keep their items themselves and send the target one
// "run one item" request per item, so that a suspended queue holds back even
// the items whose requests are already waiting on the target.

class ConcurrentQueue : public TargetedQueue {
 public:
  ConcurrentQueue(std::string label, std::shared_ptr<QueueImpl> target)
      : TargetedQueue(std::move(label), std::move(target)) {}

  void async(Work work) override {
    std::unique_lock lock(mutex_);
    used_ = true;
    items_.push_back(std::move(work));
    if (suspended_ > 0) return;
    ++requests_;
    auto target = target_;
    lock.unlock();
    request(*target);
  }

  void suspend() override {
    std::lock_guard lock(mutex_);
    ++suspended_;
  }

  void resume() override {
    std::unique_lock lock(mutex_);
    if (suspended_ == 0)
      fail("resume() on queue '%s' without a matching suspend()", label().c_str());
    if (--suspended_ > 0) return;
    resumed_.notify_all();
    std::size_t missing = items_.size() > requests_ ? items_.size() - requests_ : 0;
    requests_ += missing;
    auto target = target_;
    lock.unlock();
    for (std::size_t i = 0; i < missing; ++i) request(*target);
  }

  bool exclusive() const override { return false; }

  void acquireForSync(bool) override {
    std::unique_lock lock(mutex_);
    used_ = true;
    resumed_.wait(lock, [this] { return suspended_ == 0; });
  }

  void releaseAfterSync() override {}

 private:
  void request(QueueImpl& target) {
    target.async(
        [self = std::static_pointer_cast<ConcurrentQueue>(shared_from_this())] { self->runOne(); });
  }

  void runOne() {
    std::unique_lock lock(mutex_);
    --requests_;
    if (suspended_ > 0 || items_.empty()) return;
    Work work = std::move(items_.front());
    items_.pop_front();
    lock.unlock();
    RunningScope running(this);
    ThreadNameScope name(label());
    runItem(label(), work);
  }

  std::condition_variable resumed_;
  std::deque<Work> items_;
  std::size_t requests_ = 0;
  unsigned suspended_ = 0;
};

// ---------------------------------------------------------------------------
// The global queues: the worker pools themselves.

class GlobalQueue : public QueueImpl {
 public:
  GlobalQueue(std::string label, QueuePriority priority)
      : QueueImpl(std::move(label)), pool_(priority) {}

  void async(Work work) override {
    // The global queues live as long as the process, so `this` stays valid.
    pool_.submit([this, work = std::move(work)] {
      RunningScope running(this);
      runItem(label(), work);
    });
  }

  void suspend() override { fail("the global queue '%s' cannot be suspended", label().c_str()); }
  void resume() override { fail("the global queue '%s' cannot be resumed", label().c_str()); }
  void setTarget(std::shared_ptr<DispatchQueue>) override {
    fail("the global queue '%s' cannot be given a target", label().c_str());
  }

  std::shared_ptr<QueueImpl> parent() const override { return nullptr; }
  bool exclusive() const override { return false; }
  void acquireForSync(bool) override {}
  void releaseAfterSync() override {}

 private:
  dispatch_detail::WorkerPool pool_;
};

std::shared_ptr<QueueImpl> globalImpl(QueuePriority priority) {
  static Immortal<std::shared_ptr<QueueImpl>> defaultQueue(
      std::make_shared<GlobalQueue>("global.default", QueuePriority::Default));
  static Immortal<std::shared_ptr<QueueImpl>> backgroundQueue(
      std::make_shared<GlobalQueue>("global.background", QueuePriority::Background));
  return priority == QueuePriority::Background ? backgroundQueue.get() : defaultQueue.get();
}

// ---------------------------------------------------------------------------
// Read sources. A handler never runs twice at once, and runs again only while
// its descriptor is still ready after the previous run. The main loop waits
// for the descriptors of the main queue's sources itself, between its items,
// so that their handlers start on the main thread without a hand-over from
// another thread (nor a re-arming call per run); one event thread waits for
// all the others, each watched one-shot and armed again once its handler
// returned.

class EventSet;

struct SourceState : std::enable_shared_from_this<SourceState> {
  SourceState(UniqueFd descriptor, std::shared_ptr<DispatchQueue> target, Work work)
      : fd(std::move(descriptor)), queue(std::move(target)), handler(std::move(work)) {}

  // Our own duplicate of the watched descriptor: the watch never outlives it,
  // and a descriptor number the caller closes and reuses cannot confuse us.
  const UniqueFd fd;
  const std::shared_ptr<DispatchQueue> queue;
  EventSet* owner = nullptr;
  int epoll = -1;
  std::uint64_t id = 0;
  // The main loop's sources stay armed: the loop runs their handlers itself,
  // between its waits, so it never sees them ready while one runs. The event
  // thread's are armed once per run of the handler.
  bool levelTriggered = false;

  std::mutex mutex;
  std::condition_variable idle;
  Work handler;
  bool resumed = false;
  bool cancelled = false;
  bool running = false;
  bool pending = false;  // a run is queued
  std::thread::id runner;

  // With mutex held.
  void armLocked() {
    epoll_event event{};
    event.events = levelTriggered ? EPOLLIN : EPOLLIN | EPOLLONESHOT;
    event.data.u64 = id;
    if (epoll_ctl(epoll, EPOLL_CTL_MOD, fd.get(), &event) != 0) {
      fail("cannot watch descriptor %d: %s", fd.get(), std::strerror(errno));
    }
  }

  // On the thread that waited for the descriptor.
  void onReady() {
    {
      std::lock_guard lock(mutex);
      if (cancelled || !resumed || pending) return;
      pending = levelTriggered;
    }
    queue->async([self = shared_from_this()] { self->fire(); });
  }

  // On the source's queue.
  void fire() {
    std::unique_lock lock(mutex);
    if (cancelled) return;
    running = true;
    runner = std::this_thread::get_id();
    lock.unlock();
    runItem(queue->label(), handler);
    lock.lock();
    running = false;
    pending = false;
    Work finished;
    if (cancelled) {
      // The source went away while its handler ran (perhaps from inside it).
      finished = std::move(handler);
    } else if (!levelTriggered) {
      armLocked();
    }
    idle.notify_all();
    lock.unlock();
  }
};

// An epoll set and the sources in it. Id 0 is never a source's: the main loop
// keeps its wake-up descriptor under it.
class EventSet {
 public:
  static constexpr std::uint64_t kWakeId = 0;

  EventSet() : epoll_(epoll_create1(EPOLL_CLOEXEC)) {}

  bool ok() const { return epoll_.valid(); }
  int fd() const { return epoll_.get(); }

  // Registers the source and adds its descriptor to the set, disarmed until resumed.
  bool add(const std::shared_ptr<SourceState>& source) {
    {
      std::lock_guard lock(mutex_);
      source->id = nextId_++;
      source->owner = this;
      source->epoll = epoll_.get();
      sources_.emplace(source->id, source);
    }
    epoll_event event{};
    event.events = EPOLLONESHOT;
    event.data.u64 = source->id;
    if (epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, source->fd.get(), &event) == 0) return true;
    forget(source->id);
    return false;
  }

  void forget(std::uint64_t id) {
    std::lock_guard lock(mutex_);
    sources_.erase(id);
  }

  // Waits for events (-1: for ever); the ready sources in `ready`, and
  // whether the wake-up descriptor was among them.
  bool wait(std::vector<std::shared_ptr<SourceState>>* ready, int timeoutMs) {
    epoll_event events[32];
    int count = epoll_wait(epoll_.get(), events, 32, timeoutMs);
    if (count < 0) {
      if (errno == EINTR) return false;
      fail("waiting for descriptor events failed: %s", std::strerror(errno));
    }
    bool woken = false;
    std::lock_guard lock(mutex_);
    for (int i = 0; i < count; ++i) {
      if (events[i].data.u64 == kWakeId) {
        woken = true;
        continue;
      }
      auto it = sources_.find(events[i].data.u64);
      if (it != sources_.end()) ready->push_back(it->second);
    }
    return woken;
  }

 private:
  UniqueFd epoll_;
  std::mutex mutex_;
  std::unordered_map<std::uint64_t, std::shared_ptr<SourceState>> sources_;
  std::uint64_t nextId_ = 1;
};

class EventThread {
 public:
  EventThread() {
    if (!events_.ok()) return;
    try {
      thread_ = dispatch_detail::startThread([this] { loop(); });
    } catch (const std::system_error&) {
      started_ = false;
    }
  }

  bool ok() const { return events_.ok() && started_; }
  EventSet& events() { return events_; }

 private:
  void loop() {
    dispatch_detail::adoptWorkerThread("kst.events");
    std::vector<std::shared_ptr<SourceState>> ready;
    for (;;) {
      events_.wait(&ready, -1);
      for (const auto& source : ready) source->onReady();
      ready.clear();
    }
  }

  EventSet events_;
  bool started_ = true;
  std::thread thread_;
};

EventThread& eventThread() {
  static Immortal<EventThread> events;
  return events.get();
}

// ---------------------------------------------------------------------------
// The main queue: a serial queue drained by whoever runs the main loop. While
// it has nothing to run, the loop waits in its event set: for the main
// queue's read sources, and for the wake-up descriptor that work submitted
// from other threads (and stopMainLoop) write to.

struct MainLoop {
  MainLoop() : wake(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = EventSet::kWakeId;
    if (!events.ok() || !wake || epoll_ctl(events.fd(), EPOLL_CTL_ADD, wake.get(), &event) != 0) {
      fail("cannot make the main loop's event set: %s", std::strerror(errno));
    }
  }

  // With mutex held: gets a waiting loop out of its wait.
  void wakeLocked() {
    if (!sleeping) return;
    sleeping = false;
    const std::uint64_t one = 1;
    if (::write(wake.get(), &one, sizeof one) < 0 && errno != EAGAIN) {
      fail("cannot wake the main loop: %s", std::strerror(errno));
    }
  }

  EventSet events;
  UniqueFd wake;
  std::mutex mutex;
  bool drainRequested = false;
  bool sleeping = false;
  bool running = false;
  // Read between items without the mutex; written with it.
  std::atomic<bool> stopRequested{false};
  int status = 0;
};

MainLoop& mainLoop() {
  static Immortal<MainLoop> loop;
  return loop.get();
}

class MainQueue : public SerialQueue {
 public:
  MainQueue() : SerialQueue("main", nullptr) {}

  void setTarget(std::shared_ptr<DispatchQueue>) override {
    fail("the main queue cannot be given a target");
  }

 protected:
  void scheduleDrain() override {
    MainLoop& loop = mainLoop();
    std::lock_guard lock(loop.mutex);
    loop.drainRequested = true;
    loop.wakeLocked();
  }

  bool shouldYield() const override { return mainLoop().stopRequested.load(); }
};

std::shared_ptr<MainQueue> mainImpl() {
  static Immortal<std::shared_ptr<MainQueue>> queue(std::make_shared<MainQueue>());
  return queue.get();
}

class ReadSourceImpl : public ReadSource {
 public:
  explicit ReadSourceImpl(std::shared_ptr<SourceState> state) : state_(std::move(state)) {}

  ~ReadSourceImpl() override {
    Work handler;
    {
      std::unique_lock lock(state_->mutex);
      state_->cancelled = true;
      // With the lock held, so that a handler finishing now cannot arm it again.
      epoll_ctl(state_->epoll, EPOLL_CTL_DEL, state_->fd.get(), nullptr);
      if (state_->running && state_->runner != std::this_thread::get_id()) {
        state_->idle.wait(lock, [this] { return !state_->running; });
      }
      if (!state_->running) handler = std::move(state_->handler);
    }
    state_->owner->forget(state_->id);
  }

  ReadSourceImpl(const ReadSourceImpl&) = delete;
  ReadSourceImpl& operator=(const ReadSourceImpl&) = delete;

  void resume() override {
    std::lock_guard lock(state_->mutex);
    if (state_->resumed) return;
    state_->resumed = true;
    state_->armLocked();
  }

 private:
  std::shared_ptr<SourceState> state_;
};

}  // namespace

std::shared_ptr<DispatchQueue> DispatchQueue::createSerial(std::string label) {
  return std::make_shared<SerialQueue>(std::move(label), globalImpl(QueuePriority::Default));
}

std::shared_ptr<DispatchQueue> DispatchQueue::createConcurrent(std::string label) {
  return std::make_shared<ConcurrentQueue>(std::move(label), globalImpl(QueuePriority::Default));
}

std::shared_ptr<DispatchQueue> DispatchQueue::main() {
  return mainImpl();
}

std::shared_ptr<DispatchQueue> DispatchQueue::global(QueuePriority priority) {
  return globalImpl(priority);
}

int runMainLoop() {
  MainLoop& loop = mainLoop();
  auto queue = mainImpl();
  std::unique_lock lock(loop.mutex);
  if (loop.running) fail("runMainLoop() is already running");
  loop.running = true;
  std::vector<std::shared_ptr<SourceState>> ready;
  while (!loop.stopRequested.load()) {
    // With items to run, only a look at the sources: a busy queue does not
    // keep their handlers waiting for ever.
    const bool idle = !loop.drainRequested;
    loop.sleeping = idle;
    lock.unlock();
    const bool woken = loop.events.wait(&ready, idle ? -1 : 0);
    lock.lock();
    loop.sleeping = false;
    lock.unlock();
    if (woken) {
      std::uint64_t count = 0;
      (void)::read(loop.wake.get(), &count, sizeof count);
    }
    // Each handler becomes an item of the main queue, drained right here.
    for (const auto& source : ready) source->onReady();
    ready.clear();
    lock.lock();
    if (loop.drainRequested) {
      loop.drainRequested = false;
      lock.unlock();
      queue->drain();
      lock.lock();
    }
  }
  loop.stopRequested.store(false);
  loop.running = false;
  return loop.status;
}

void stopMainLoop(int status) {
  MainLoop& loop = mainLoop();
  std::lock_guard lock(loop.mutex);
  loop.status = status;
  loop.stopRequested.store(true);
  loop.wakeLocked();
}

std::unique_ptr<ReadSource> ReadSource::create(int fd, std::shared_ptr<DispatchQueue> queue,
                                               Work handler) {
  if (!queue) fail("ReadSource::create() needs a queue");
  EventSet* events = nullptr;
  const bool main = queue == std::static_pointer_cast<DispatchQueue>(mainImpl());
  if (main) {
    events = &mainLoop().events;
  } else if (eventThread().ok()) {
    events = &eventThread().events();
  } else {
    return nullptr;
  }
  UniqueFd duplicate(fcntl(fd, F_DUPFD_CLOEXEC, 0));
  if (!duplicate) return nullptr;
  auto state =
      std::make_shared<SourceState>(std::move(duplicate), std::move(queue), std::move(handler));
  state->levelTriggered = main;
  if (!events->add(state)) return nullptr;
  return std::make_unique<ReadSourceImpl>(std::move(state));
}

std::unique_ptr<ReadSource> watchTerminationSignals(std::function<void(int signal)> handler) {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  auto fd = std::make_shared<UniqueFd>(signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
  if (!fd->valid()) return nullptr;
  const int raw = fd->get();
  // The handler owns the signal descriptor, so it stays open for as long as
  // the handler can run. One signal per run: the watch fires again while more
  // are pending.
  auto source = ReadSource::create(raw, DispatchQueue::main(),
                                   [fd = std::move(fd), handler = std::move(handler)] {
                                     signalfd_siginfo info{};
                                     if (read(fd->get(), &info, sizeof info) == sizeof info) {
                                       handler(static_cast<int>(info.ssi_signo));
                                     }
                                   });
  if (source) source->resume();
  return source;
}

}  // namespace kestrel::platform
