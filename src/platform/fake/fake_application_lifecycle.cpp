#include "platform/fake/fake_application_lifecycle.h"

#include <atomic>

#include "platform/dispatch.h"

namespace kestrel::platform {

class FakeApplicationLifecycle::Assertion final : public TerminationAssertion {
 public:
  Assertion(std::weak_ptr<FakeApplicationLifecycle> owner, std::string identifier)
      : owner_(std::move(owner)), identifier_(std::move(identifier)) {}
  void invalidate() override {
    if (invalidated_.exchange(true)) return;
    if (auto owner = owner_.lock()) owner->release(identifier_);
  }

 private:
  std::weak_ptr<FakeApplicationLifecycle> owner_;
  std::string identifier_;
  std::atomic<bool> invalidated_{false};
};

void FakeApplicationLifecycle::setReport(TerminationReport report) {
  const std::lock_guard lock(mutex_);
  report_ = std::move(report);
}

void FakeApplicationLifecycle::setUnavailable(bool unavailable) {
  const std::lock_guard lock(mutex_);
  unavailable_ = unavailable;
}

std::vector<FakeApplicationLifecycle::Acquisition> FakeApplicationLifecycle::acquisitions() const {
  const std::lock_guard lock(mutex_);
  return acquisitions_;
}

std::size_t FakeApplicationLifecycle::invalidations() const {
  const std::lock_guard lock(mutex_);
  return invalidations_;
}

std::shared_ptr<TerminationAssertion> FakeApplicationLifecycle::acquireTerminationAssertion(
    const std::string& signingIdentifier, TerminationReason reason,
    std::function<void(const TerminationReport& report)> completion) {
  TerminationReport report;
  {
    const std::lock_guard lock(mutex_);
    acquisitions_.push_back({signingIdentifier, reason});
    if (unavailable_) return nullptr;
    ++held_[signingIdentifier];
    report = report_;
  }
  DispatchQueue::global()->async(
      [report = std::move(report), completion = std::move(completion)] { completion(report); });
  return std::make_shared<Assertion>(weak_from_this(), signingIdentifier);
}

bool FakeApplicationLifecycle::isHeldTerminated(const std::string& signingIdentifier) {
  const std::lock_guard lock(mutex_);
  return held_.count(signingIdentifier) > 0;
}

void FakeApplicationLifecycle::release(const std::string& signingIdentifier) {
  const std::lock_guard lock(mutex_);
  ++invalidations_;
  if (const auto found = held_.find(signingIdentifier);
      found != held_.end() && --found->second == 0) {
    held_.erase(found);
  }
}

}  // namespace kestrel::platform
