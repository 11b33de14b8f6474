#include "protection/data_protection_manager.h"

#include <atomic>
#include <memory>
#include <mutex>
#include <utility>

#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "protection/data_protection_change_operation.h"
#include "store/container_cache.h"
#include "store/container_identifier.h"
#include "termination/application_termination_assertion.h"

namespace kestrel {

namespace {

// A container that records no class is in class 3.
constexpr std::int32_t kClassWhenUnrecorded = 3;
constexpr std::int32_t kNeverSetClass = 2;

using Op = KSTDataProtectionChangeOperation;

std::int32_t recordedClass(const KSTMetadata& container) {
  const std::optional<PlistDictionary> info = container.info();
  if (!info) return kClassWhenUnrecorded;
  const auto found = info->find(kKSTContentProtectionClassInfoKey);
  if (found == info->end()) return kClassWhenUnrecorded;
  if (const auto number = found->second.signedInteger()) return static_cast<std::int32_t>(*number);
  return kClassWhenUnrecorded;
}

// Lowering a class number protects more: everything moves, and no file is
// raised on the way. Raising it moves the directories only, except out of
// class 0 (which files never have), where files follow too.
std::uint32_t operationType(std::int32_t current, std::int32_t requested) {
  const std::uint32_t everything =
      Op::kChangeDirectories | Op::kChangeFiles | Op::kNeverRaiseFileClass;
  if (current > requested) return everything;
  if (requested >= 3) return Op::kChangeDirectories;
  return current == 0 ? everything : Op::kChangeDirectories;
}

// The termination assertion taken when a change is first retried; it lives
// until the change ends.
struct HeldTermination {
  std::mutex mutex;
  std::unique_ptr<KSTApplicationTerminationAssertion> assertion;

  void release() {
    const std::lock_guard lock(mutex);
    if (assertion) assertion->invalidate();
    assertion.reset();
  }
};

// The request's completion, called at most once whoever gets there first.
class RequestCompletion {
 public:
  explicit RequestCompletion(std::function<void(std::uint64_t)> completion)
      : completion_(std::move(completion)) {}
  void call(std::uint64_t code) {
    if (answered_.exchange(true)) return;
    if (completion_) completion_(code);
  }

 private:
  std::function<void(std::uint64_t)> completion_;
  std::atomic<bool> answered_{false};
};

}  // namespace

KSTDataProtectionManager& KSTDataProtectionManager::defaultManager() {
  static KSTDataProtectionManager manager;
  return manager;
}

void KSTDataProtectionManager::setDataProtectionOnDataContainerForUser(
    std::uint32_t userId, const std::optional<std::string>& identifier,
    KSTContainerClass containerClass, std::int32_t dataProtectionClass,
    bool isSecondOrThirdPartyApp, bool retryIfLocked,
    std::function<void(std::uint64_t code)> withCompletion) {
  const char* const function = __func__;
  const auto answer = std::make_shared<RequestCompletion>(std::move(withCompletion));
  std::uint64_t code = kKSTSuccess;
  // Set when the change was handed to an operation, whose completion answers.
  bool handedOver = false;
  KST_CATCH_EXCEPTIONS(&code, [&] {
    if (!identifier || !KSTIsPerUserClass(containerClass)) {
      KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorInvalidObject, nullptr, true,
                                   "Can't act on an invalid object: userId: %u, ID: %@, class: %ld",
                                   userId, KSTIdentifierForLog(identifier), containerClass),
                      &code);
      return;
    }
    KSTErrorRef cacheError;
    const KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
        userId, containerClass, *identifier, false, &cacheError);
    if (!container) {
      if (cacheError && cacheError->domain() == kKSTErrorDomain &&
          cacheError->code() == kKSTErrorNotFound) {
        cacheError = nullptr;
      }
      KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorNotFound, cacheError, true,
                                   "No Container with userId: %u, identifier: %@, Class: %ld",
                                   userId, KSTIdentifierForLog(identifier), containerClass),
                      &code);
      return;
    }

    const std::int32_t current = recordedClass(*container);
    if (current == dataProtectionClass) return;
    if (dataProtectionClass == kNeverSetClass) {
      KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorInvalidParameter, nullptr, true,
                                   "Data protection class %d is not allowed", dataProtectionClass),
                      &code);
      return;
    }
    if (isSecondOrThirdPartyApp && (dataProtectionClass < 0 || dataProtectionClass > 3)) {
      KSTHandOverCode(KST_ERROR_IN(function, kKSTErrorInvalidParameter, nullptr, true,
                                   "Data protection class %d is invalid for 2nd and 3rd party apps",
                                   dataProtectionClass),
                      &code);
      return;
    }

    const std::shared_ptr<Op> operation = Op::dataProtectionChangeOperationWithContainerMetadata(
        container, dataProtectionClass, retryIfLocked, operationType(current, dataProtectionClass));
    auto held = std::make_shared<HeldTermination>();
    operation->setRetryStartBlock([held, bundleIdentifier = *identifier] {
      auto assertion = KSTApplicationTerminationAssertion::initWithBundleIdentifier(
          bundleIdentifier, kKSTTerminationReasonInstallation);
      const std::lock_guard lock(held->mutex);
      held->assertion = std::move(assertion);
    });
    operation->setCompletionBlock([held, container, dataProtectionClass, retryIfLocked, function,
                                   answer](bool wasLocked, const KSTErrorRef& error) {
      std::uint64_t result = kKSTSuccess;
      if (error) {
        KSTLogTag(kLogError, function,
                  "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                  container->identifier(), container->url(), dataProtectionClass, error);
        KSTHandOverCode(error, &result);
      }
      if (wasLocked && retryIfLocked) {
        KSTLogTag(kLogError, function, "Unexpectedly got completion block called with wasLocked");
      }
      held->release();
      if (!wasLocked && !error) {
        std::uint64_t infoCode = kKSTSuccess;
        KSTClientConnection::sharedClientConnection().setInfoValue(
            PlistValue(std::int64_t{dataProtectionClass}), kKSTContentProtectionClassInfoKey,
            container->uid(), container->uuid(), container->identifier(),
            container->containerClass(), true, &infoCode);
        if (infoCode != kKSTSuccess) {
          KSTLogTag(kLogError, function,
                    "Failed to set protection class info for %@ at %@ to %d : %llu",
                    container->identifier(), container->url(), dataProtectionClass, infoCode);
        }
      }
      answer->call(result);
    });
    handedOver = true;
    operation->performChangeOperation();
  });
  // Refused, or nothing to change; or an exception that stopped the change
  // before its completion answered.
  if (!handedOver || code != kKSTSuccess) answer->call(code);
}

}  // namespace kestrel
