// A beat run on a queue at a fixed period, for as long as the queue runs: the
// next beat is queued only once the previous one has run, so a queue that is
// stuck stops the beats (and queues at most one) instead of piling them up.
// The daemon answers the service manager's watchdog this way from its main
// queue, so that a main queue that no longer runs gets the daemon restarted.
#pragma once

#include <chrono>
#include <memory>

#include "platform/dispatch.h"

namespace kestrel::platform {

class Heartbeat {
 public:
  virtual ~Heartbeat() = default;
  // Beats on the queue every period, starting one period from now, until the
  // returned object is destroyed (a beat already queued may still run then).
  // nullptr when the timing thread cannot be started.
  static std::unique_ptr<Heartbeat> start(std::shared_ptr<DispatchQueue> queue,
                                          std::chrono::microseconds period, Work beat);
};

}  // namespace kestrel::platform
