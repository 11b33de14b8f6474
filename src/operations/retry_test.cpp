// The retry test: lets a client prove that it copes with a daemon that dies in
// the middle of its request. A counter kept in a test container survives each
// death; every request counts it down and, until it reaches zero, the daemon
// exits without replying, so that the client's retry reaches the restarted
// daemon. Offered on internal builds only (command 25).
#include <chrono>
#include <thread>

#include "daemon/client_connection.h"
#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "platform/process.h"

namespace kestrel {
namespace {

constexpr const char* kRetryTestIdentifier = "com.zorvane.retryTest";
constexpr const char* kCrashCounterKey = "CrashCounter";

std::uint64_t storedCounter(const KSTMetadataRef& container, std::uint64_t requested) {
  const std::optional<PlistDictionary> info = container->info();
  if (!info) return requested;
  auto it = info->find(kCrashCounterKey);
  if (it == info->end()) return requested;
  const std::uint32_t counter = static_cast<std::uint32_t>(it->second.unsignedInteger().value_or(
      static_cast<std::uint64_t>(it->second.signedInteger().value_or(0))));
  return static_cast<std::uint64_t>(counter) - 1;
}

}  // namespace

void KSTClientConnection::retryTestForUser(std::uint32_t userId, std::uint64_t withNumCrashes,
                                           std::uint64_t* withError) {
  const char* const operation = __func__;
  KST_CATCH_EXCEPTIONS(withError, [&] {
    const KSTMetadataRef container =
        createOrLookupContainerForUser(userId, std::string(kRetryTestIdentifier), true,
                                       kKSTContainerClassDataApplication, false, true, withError);
    if (!container) {
      KSTLogTag(kLogError, operation,
                "Failed to create or lookup lookup existing container for retry test: %@",
                kRetryTestIdentifier);
      return;
    }
    const std::uint64_t remaining = storedCounter(container, withNumCrashes);
    KSTLogTag(kLogError, operation, "Crashes Remaining in retry test: %llu",
              static_cast<unsigned long long>(remaining));
    setInfoValue(PlistValue(remaining), std::string(kCrashCounterKey), userId, container->uuid(),
                 std::string(kRetryTestIdentifier), kKSTContainerClassDataApplication, true,
                 withError);
    if (remaining != 0) {
      KSTLogTag(kLogError, operation, "Crashing");
      std::this_thread::sleep_for(std::chrono::seconds(2));
      Log::flush();
      platform::exitProcessNow(0);
    }
    stageForDeleteContainersWithUsers({userId}, {container->uuid()},
                                      std::vector<std::optional<std::string>>{kRetryTestIdentifier},
                                      {kKSTContainerClassDataApplication}, true, withError);
    if (*withError != kKSTSuccess) {
      KSTLogTag(kLogError, operation, "Failed to delete retry container at : %@", container->url());
    } else {
      KSTLogTag(kLogError, operation, "Returning Successfully");
    }
  });
}

}  // namespace kestrel
