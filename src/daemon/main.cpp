// kestreld: reads no arguments and no configuration file; its root directory
// (KESTREL_ROOT) is part of its environment.
#include <csignal>
#include <cstdlib>

#include "daemon/log.h"
#include "daemon/request_dispatch.h"
#include "daemon/startup.h"
#include "platform/dispatch.h"
#include "platform/heartbeat.h"
#include "platform/process.h"
#include "platform/services.h"

int main() {
  using namespace kestrel;
  // Before any thread starts, so that every thread has the signals blocked.
  auto signals = platform::watchTerminationSignals([](int signal) {
    KSTLogTag(kLogNotice, "main", "Received signal %d, exiting", signal);
    platform::notifyServiceManagerStopping();
    platform::stopMainLoop(0);
  });
  signals->resume();

  platform::installServices(platform::makeLinuxServices(platform::FilesystemRoot::fromEnvironment()));

  KSTStartupHooks hooks;
  hooks.startListener = KSTStartRequestListener;
  hooks.ready = [] { platform::notifyServiceManagerReady(); };
  if (KSTDaemonStart(hooks) != 0) {
    Log::flush();
    return -1;
  }
  // The service manager's watchdog is answered from the main queue, twice per
  // interval: when the main queue stops running, the answers stop and the
  // service manager restarts the daemon.
  std::unique_ptr<platform::Heartbeat> watchdog;
  if (const auto interval = platform::serviceManagerWatchdogInterval(); interval.count() > 0) {
    watchdog = platform::Heartbeat::start(platform::DispatchQueue::main(), interval / 2,
                                          platform::notifyServiceManagerAlive);
    if (!watchdog) KSTLogTag(kLogError, "main", "Failed to start the watchdog heartbeat");
  }
  const int status = platform::runMainLoop();
  Log::flush();
  // Work still queued on other threads is abandoned: everything the daemon
  // keeps on disk is written atomically or journalled.
  std::_Exit(status);
}
