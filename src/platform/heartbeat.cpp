#include "platform/heartbeat.h"

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <stop_token>
#include <system_error>
#include <thread>

namespace kestrel::platform {

namespace {

class ThreadHeartbeat final : public Heartbeat {
 public:
  ThreadHeartbeat(std::shared_ptr<DispatchQueue> queue, std::chrono::microseconds period, Work beat)
      : queue_(std::move(queue)), period_(period), beat_(std::make_shared<Work>(std::move(beat))) {}

  // std::jthread asks the thread to stop and joins it.
  ~ThreadHeartbeat() override = default;

  void startThread() {
    thread_ = std::jthread([this](std::stop_token stop) { run(stop); });
  }

 private:
  void run(std::stop_token stop) {
    std::mutex mutex;
    std::condition_variable_any wake;
    std::unique_lock lock(mutex);
    while (true) {
      wake.wait_for(lock, stop, period_, [] { return false; });
      if (stop.stop_requested()) return;
      // The flag and the beat are shared with the queued item, which may run
      // after this object is gone.
      if (pending_->exchange(true)) continue;
      queue_->async([pending = pending_, beat = beat_] {
        (*beat)();
        pending->store(false);
      });
    }
  }

  std::shared_ptr<DispatchQueue> queue_;
  const std::chrono::microseconds period_;
  std::shared_ptr<Work> beat_;
  std::shared_ptr<std::atomic<bool>> pending_ = std::make_shared<std::atomic<bool>>(false);
  std::jthread thread_;
};

}  // namespace

std::unique_ptr<Heartbeat> Heartbeat::start(std::shared_ptr<DispatchQueue> queue,
                                            std::chrono::microseconds period, Work beat) {
  auto heartbeat = std::make_unique<ThreadHeartbeat>(std::move(queue), period, std::move(beat));
  try {
    heartbeat->startThread();
  } catch (const std::system_error&) {
    return nullptr;
  }
  return heartbeat;
}

}  // namespace kestrel::platform
