// Moving a data container's files to another data-protection class, as the
// installer asks (command 21): the request is checked against the class the
// container records, the files are walked by a KSTDataProtectionChangeOperation
// and, when it succeeded, the new class is recorded in the container's info.
// A change that has to wait for the device's next unlock holds the
// application terminated from the moment it is tried again until it ends.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "store/container_class.h"

namespace kestrel {

// Where a container's info dictionary records its class (a number).
inline constexpr const char* kKSTContentProtectionClassInfoKey =
    "com.zorvane.Tessel.ContentProtectionClass";

class KSTDataProtectionManager {
 public:
  static KSTDataProtectionManager& defaultManager();

  // The completion gets the request's code exactly once: at once when the
  // request is refused (11, 21, 38) or needs no change (1), else when the
  // change has ended, possibly after the next unlock and on the lock-state
  // queue (1, 10, 21, 61 when locked without retryIfLocked, or the walk's
  // POSIX error).
  void setDataProtectionOnDataContainerForUser(
      std::uint32_t userId, const std::optional<std::string>& identifier,
      KSTContainerClass containerClass, std::int32_t dataProtectionClass,
      bool isSecondOrThirdPartyApp, bool retryIfLocked,
      std::function<void(std::uint64_t code)> withCompletion);

 private:
  KSTDataProtectionManager() = default;
};

}  // namespace kestrel
