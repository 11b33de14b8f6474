#include "termination/application_termination_assertion.h"

#include <memory>
#include <semaphore>

#include "daemon/invariant.h"
#include "daemon/log.h"
#include "platform/process.h"
#include "platform/services.h"

namespace kestrel {

namespace {

platform::TerminationReason platformReason(int reason) {
  switch (reason) {
    case kKSTTerminationReasonInstallation:
      return platform::TerminationReason::Installation;
    case kKSTTerminationReasonCacheDeletion:
      return platform::TerminationReason::CacheDeletion;
    case kKSTTerminationReasonCritical:
      return platform::TerminationReason::Critical;
    default:
      break;
  }
  const std::string message = formatMessage("Unknown reason: %d", reason);
  KSTLogTag(kLogError, "initWithBundleIdentifier", "%s", message);
  platform::abortWithCrashMessage(message);
}

// What the platform's completion hands back to the waiting creator. Shared,
// so that a completion arriving late never touches a finished creation.
struct Answer {
  std::binary_semaphore done{0};
  bool acquired = true;
};

}  // namespace

std::unique_ptr<KSTApplicationTerminationAssertion>
KSTApplicationTerminationAssertion::initWithBundleIdentifier(const std::string& bundleIdentifier,
                                                             int reason) {
  const platform::TerminationReason mapped = platformReason(reason);
  const auto& lifecycle = platform::services().applicationLifecycle;
  auto answer = std::make_shared<Answer>();
  const char* const function = __func__;
  std::shared_ptr<platform::TerminationAssertion> termAssertion;
  if (lifecycle) {
    termAssertion = lifecycle->acquireTerminationAssertion(
        bundleIdentifier, mapped,
        [answer, bundleIdentifier, function](const platform::TerminationReport& report) {
          if (report.error) {
            KSTLogTag(kLogError, function, "Failed to acquire termination assertion for %@ : %@",
                      bundleIdentifier, report);
            answer->acquired = false;
          } else {
            KSTLogTag(kLogNotice, function, "Holding %@ terminated: %@", bundleIdentifier, report);
          }
          answer->done.release();
        });
  }
  if (!termAssertion) {
    KSTLog(kLogError, "Could not get a termination assertion for %@", bundleIdentifier);
    return nullptr;
  }
  answer->done.acquire();
  if (!answer->acquired) {
    termAssertion->invalidate();
    return nullptr;
  }
  return std::make_unique<KSTApplicationTerminationAssertion>(Held{}, std::move(termAssertion));
}

KSTApplicationTerminationAssertion::~KSTApplicationTerminationAssertion() {
  KST_INVARIANT(nullptr == termAssertion_);
}

void KSTApplicationTerminationAssertion::invalidate() {
  if (!termAssertion_) return;
  termAssertion_->invalidate();
  termAssertion_ = nullptr;
}

}  // namespace kestrel
