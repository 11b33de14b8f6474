// The application lifecycle: holding an application terminated. While a
// termination assertion for a signing identifier is held, the processes of
// that identity are ended and no new one is served; invalidating the
// assertion lets the application run again.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace kestrel::platform {

// Why an application is held terminated.
enum class TerminationReason { Installation, CacheDeletion, Critical };

// What taking an assertion did.
struct TerminationReport {
  struct EndedProcess {
    pid_t pid = 0;
    // It outlived the grace period after SIGTERM and was sent SIGKILL.
    bool killed = false;
  };
  std::vector<EndedProcess> ended;
  // Set when the application could not be held terminated (a process that
  // could not be ended, a process list that could not be read).
  std::optional<std::string> error;

  // "ended 2 processes (pid 41, pid 42 killed)", or "no process running";
  // the error after it, when there is one.
  std::string description() const;
};

class TerminationAssertion {
 public:
  virtual ~TerminationAssertion() = default;
  // Lets the application run again. Calling it again does nothing.
  virtual void invalidate() = 0;
};

class ApplicationLifecycle {
 public:
  virtual ~ApplicationLifecycle() = default;

  // Starts holding the application of the signing identifier terminated and
  // returns at once: from here on, isHeldTerminated() says so. The processes
  // of the identity are ended on another thread, which then calls the
  // completion once with what happened. nullptr (and no completion) when the
  // request could not be made at all.
  virtual std::shared_ptr<TerminationAssertion> acquireTerminationAssertion(
      const std::string& signingIdentifier, TerminationReason reason,
      std::function<void(const TerminationReport& report)> completion) = 0;

  // Whether an assertion that was not invalidated holds the identity terminated.
  virtual bool isHeldTerminated(const std::string& signingIdentifier) = 0;
};

}  // namespace kestrel::platform
