#include "daemon/startup.h"

#include <syslog.h>

#include <cstring>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/log.h"
#include "platform/keep_alive.h"
#include "platform/services.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

constexpr std::size_t kInternalLogFileCount = 4;
constexpr std::size_t kInternalLogFileSize = 262144;
constexpr std::size_t kLogFileCount = 1;
constexpr std::size_t kLogFileSize = 102400;

// The global log directory (made on every call).
std::string logDirectory() {
  return KSTGlobalConfiguration::sharedInstance().logDirectory().path();
}

void set_first_boot_work_completed() {
  const int err = platform::services().semaphores->create(kKSTFirstBootSemaphoreName, 0400, 0);
  if (err != 0) {
    KSTLog(kLogError, "Failed to create semaphore %s: %s", kKSTFirstBootSemaphoreName,
           std::strerror(err));
  }
}

}  // namespace

std::string KSTLogPath() { return logDirectory() + "/" + kKSTLogFileName; }

int KSTDaemonStart(const KSTStartupHooks& hooks) {
  const platform::Services& services = platform::services();
  // 1. Start-up runs inside one keep-alive transaction.
  std::optional<platform::KeepAliveTransaction> transaction;
  transaction.emplace(services.keepAlive);

  // 2-4. The rotating log.
  const std::string logPath = KSTLogPath();
  if (!Log::open(kKSTServiceName, logPath, kLogNotice)) {
    services.logging->writeSystemLog(
        LOG_ERR, formatMessage("Failed to set up rotating logs at path %s", logPath));
  }
  const bool internal = services.deviceInfo->isInternalBuild();
  Log::enableDiskLogging(logPath, internal ? kInternalLogFileCount : kLogFileCount,
                         internal ? kInternalLogFileSize : kLogFileSize, 0);

  // 5.
  KSTLogTag(kLogDebug, "main", "kestreld built at %s %s started", __DATE__, __TIME__);

  // 6-7. Work queues.
  if (!KSTCreateWorkQueues()) {
    KSTLogTag(kLogError, "main", "Can't create dispatch queues. Exiting.");
    return -1;
  }
  KSTDeathRowQueue()->setTarget(platform::DispatchQueue::global(platform::QueuePriority::Background));

  // 8.
  KSTClientConnection& shared = KSTClientConnection::sharedClientConnection();

  // 9. The first start since the system booted does the boot-time work.
  const bool firstBoot = !services.semaphores->openExisting(kKSTFirstBootSemaphoreName);
  if (firstBoot) {
    KSTLogTag(kLogNotice, "main", "kestreld performing first boot initialization");
    shared.rebootContainerManagerSetup();
  }

  // 10.
  shared.containerManagerSetup();

  // 11.
  if (!KSTKernServerStart()) return -1;

  // 12-13. Lock state.
  const int status = services.keyBag->registerLockStatusNotification(
      platform::DispatchQueue::main(), [] { KSTLockStateChanged(); });
  if (status != 0) {
    KSTLogTag(kLogError, "main", "Failed to register for %s: %d",
              platform::KeyBag::kLockStatusNotification, status);
  }
  KSTLockStateChanged();

  // 14.
  if (firstBoot) {
    shared.rebootContainerManagerCleanup();
    KSTLogTag(kLogNotice, "main", "kestreld first boot cleanup complete");
    set_first_boot_work_completed();
  }

  // 15.
  shared.containerManagerCleanup();

  // 16.
  transaction.reset();

  // 17. Requests begin only now.
  auto listenerQueue = platform::DispatchQueue::createConcurrent(kKSTListenerQueueLabel);
  KSTSetListenerQueue(listenerQueue);
  const bool listening = listenerQueue && hooks.startListener && hooks.startListener(listenerQueue);
  if (!listening) KSTLogTag(kLogError, "main", "unable to start vexel service!");
  if (hooks.ready) hooks.ready();
  return 0;
}

}  // namespace kestrel
