// An application lifecycle for tests: records every assertion taken and
// invalidated, holds identifiers as the real one does, and answers each
// acquisition, on a pool thread, with the report set up (none ended, by
// default), or refuses to make an assertion at all.
#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/application_lifecycle.h"

namespace kestrel::platform {

class FakeApplicationLifecycle final
    : public ApplicationLifecycle,
      public std::enable_shared_from_this<FakeApplicationLifecycle> {
 public:
  struct Acquisition {
    std::string signingIdentifier;
    TerminationReason reason;
  };

  void setReport(TerminationReport report);
  // While set, acquireTerminationAssertion() returns nothing.
  void setUnavailable(bool unavailable);

  std::vector<Acquisition> acquisitions() const;
  std::size_t invalidations() const;

  std::shared_ptr<TerminationAssertion> acquireTerminationAssertion(
      const std::string& signingIdentifier, TerminationReason reason,
      std::function<void(const TerminationReport& report)> completion) override;
  bool isHeldTerminated(const std::string& signingIdentifier) override;

 private:
  class Assertion;
  void release(const std::string& signingIdentifier);

  mutable std::mutex mutex_;
  TerminationReport report_;
  bool unavailable_ = false;
  std::vector<Acquisition> acquisitions_;
  std::size_t invalidations_ = 0;
  std::map<std::string, std::size_t> held_;
};

}  // namespace kestrel::platform
