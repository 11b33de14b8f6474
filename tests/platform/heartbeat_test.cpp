#include "platform/heartbeat.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

namespace kestrel::platform {
namespace {

using namespace std::chrono_literals;

// The beats follow the queue: none while it is stuck, no pile-up of missed
// beats once it runs again, none once the heartbeat is gone.
TEST(HeartbeatTest, BeatsOnlyWhileTheQueueRuns) {
  auto queue = DispatchQueue::createSerial("heartbeat-test");
  std::atomic<int> beats{0};
  auto heartbeat = Heartbeat::start(queue, 1ms, [&] { ++beats; });
  ASSERT_TRUE(heartbeat);
  const auto waitFor = [&](int target) {
    const auto deadline = std::chrono::steady_clock::now() + 5s;
    while (beats < target && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(1ms);
    }
    return beats >= target;
  };
  ASSERT_TRUE(waitFor(3));

  queue->suspend();
  std::this_thread::sleep_for(10ms);  // a beat that had started ends
  const int stuck = beats;
  std::this_thread::sleep_for(200ms);  // two hundred periods
  EXPECT_EQ(beats, stuck);
  queue->resume();
  ASSERT_TRUE(waitFor(stuck + 1));
  EXPECT_LT(beats, stuck + 50);  // the missed beats were not queued up

  heartbeat.reset();
  queue->sync([] {});  // a beat queued before the reset has run
  const int last = beats;
  std::this_thread::sleep_for(50ms);
  EXPECT_EQ(beats, last);
}

}  // namespace
}  // namespace kestrel::platform
