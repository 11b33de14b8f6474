// The daemon's start-up, in its fixed order, and its main loop.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/dispatch.h"

namespace kestrel {

struct KSTStartupHooks {
  // Opens the IPC listener with its handlers on the queue; false when it cannot be made.
  std::function<bool(std::shared_ptr<platform::DispatchQueue> queue)> startListener;
  // Called once start-up is complete and the daemon is about to serve (service-manager readiness).
  std::function<void()> ready;
};

// The log path: the global log directory with "kestreld.log" appended.
std::string KSTLogPath();

// Runs start-up up to and including opening the listener. 0 when the daemon
// may enter its main loop, -1 when it must exit.
int KSTDaemonStart(const KSTStartupHooks& hooks);

// Registers the kernel upcall server on the main queue; false when it cannot
// be registered (start-up then exits).
bool KSTKernServerStart();

}  // namespace kestrel
