// Holding an application terminated on Linux. An application is the set of
// processes whose signing identity, as the code-signing identity service
// resolves them (by label, or by executable), is the identifier. Taking an
// assertion marks the identifier held at once, then, on a pool thread,
// sends SIGTERM to each such process through its pidfd (so that a reused
// pid is never hit), waits for them to end for the grace period, sends
// SIGKILL to those still running and waits for those too; the completion
// gets the list. While held, admission refuses new processes of the
// identity (the daemon asks isHeldTerminated()); a process of the identity
// started meanwhile that never asks the daemon for anything runs on.
#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "platform/application_lifecycle.h"
#include "platform/code_signing_identity.h"

namespace kestrel::platform {

class LinuxApplicationLifecycle final : public ApplicationLifecycle {
 public:
  static constexpr std::chrono::milliseconds kDefaultGracePeriod{2000};

  explicit LinuxApplicationLifecycle(std::shared_ptr<CodeSigningIdentity> identity,
                                     std::chrono::milliseconds gracePeriod = kDefaultGracePeriod);

  std::shared_ptr<TerminationAssertion> acquireTerminationAssertion(
      const std::string& signingIdentifier, TerminationReason reason,
      std::function<void(const TerminationReport& report)> completion) override;
  bool isHeldTerminated(const std::string& signingIdentifier) override;

  // The identifiers held and how many assertions hold each; shared with the
  // assertions, which may outlive this object.
  struct Holds {
    std::mutex mutex;
    std::map<std::string, std::size_t, std::less<>> counts;
  };

 private:
  const std::shared_ptr<CodeSigningIdentity> identity_;
  const std::chrono::milliseconds gracePeriod_;
  const std::shared_ptr<Holds> holds_;
};

// Ends every process (other than this one) that the identity service
// resolves to the identifier, as above. Blocks until they ended or the
// waits are over.
TerminationReport endProcessesOfIdentity(CodeSigningIdentity& identity,
                                         const std::string& signingIdentifier,
                                         std::chrono::milliseconds gracePeriod);

}  // namespace kestrel::platform
