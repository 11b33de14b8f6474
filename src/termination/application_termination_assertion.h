// Holding an application terminated while the daemon changes something the
// running application must not see half-done (its data container's
// protection classes). Taking the assertion asks the platform's lifecycle
// service to end the application's processes and keep it from running, and
// waits until the service has done so; invalidating it lets the application
// run again. Every assertion taken must be invalidated before it goes: one
// that is destroyed while it still holds stops the process.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "platform/application_lifecycle.h"

namespace kestrel {

// Reason codes, as callers name them.
inline constexpr int kKSTTerminationReasonInstallation = 0;
inline constexpr int kKSTTerminationReasonCacheDeletion = 1;
inline constexpr int kKSTTerminationReasonCritical = 255;

class KSTApplicationTerminationAssertion {
 public:
  // Holds the application of the bundle identifier terminated, blocking the
  // calling thread until the platform answered. Nothing when the assertion
  // could not be taken (the caller then goes on without it). A reason other
  // than the three above is a programming error and aborts.
  static std::unique_ptr<KSTApplicationTerminationAssertion> initWithBundleIdentifier(
      const std::string& bundleIdentifier, int reason);

  KSTApplicationTerminationAssertion(const KSTApplicationTerminationAssertion&) = delete;
  KSTApplicationTerminationAssertion& operator=(const KSTApplicationTerminationAssertion&) = delete;
  ~KSTApplicationTerminationAssertion();

  // Lets the application run again. Calling it again does nothing.
  void invalidate();

 private:
  struct Held {};

 public:
  // Made only by initWithBundleIdentifier.
  KSTApplicationTerminationAssertion(Held, std::shared_ptr<platform::TerminationAssertion> held)
      : termAssertion_(std::move(held)) {}

 private:
  std::shared_ptr<platform::TerminationAssertion> termAssertion_;
};

}  // namespace kestrel
