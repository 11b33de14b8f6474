// The key bag: whether the device is locked, a notification when that changes,
// the device's user mode and its user sessions.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch.h"

namespace kestrel::platform {

enum class DeviceMode { SingleUser, MultiUser };

struct UserTypeInfo {
  DeviceMode deviceMode = DeviceMode::SingleUser;
};

class KeyBag {
 public:
  static constexpr int kUnlocked = 0;
  static constexpr int kLocked = 1;
  static constexpr const char* kLockStatusNotification = "com.zorvane.keybag.lock-status";

  virtual ~KeyBag() = default;
  // 0 unlocked, 1 locked; other values for states that are neither.
  virtual int lockState() = 0;
  // The handler runs on the queue each time the lock state may have changed.
  // 0 on success, else an error status.
  virtual int registerLockStatusNotification(std::shared_ptr<DispatchQueue> queue,
                                             Work handler) = 0;
  // nullopt when the device has no user-type information.
  virtual std::optional<UserTypeInfo> userTypeInfo() = 0;
  // The user ids of the sessions of a multi-user device; nullopt with an error text on failure.
  virtual std::optional<std::vector<std::uint32_t>> userSessionIds(std::string* error) = 0;
};

}  // namespace kestrel::platform
