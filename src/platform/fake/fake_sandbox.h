// A sandbox for tests: records every call in order, keeps the items like the
// real table, and can be told to fail removals and/or settings with a status.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/sandbox_linux.h"
#include "platform/sandbox.h"

namespace kestrel::platform {

struct FakeSandboxCall {
  std::uint32_t userId = 0;
  std::uint64_t itemType = 0;
  std::string identifier;
  std::optional<std::string> path;  // nullopt for a removal
  std::uint64_t flags = 0;

  bool isRemoval() const { return !path.has_value(); }
  friend bool operator==(const FakeSandboxCall&, const FakeSandboxCall&) = default;
};

class FakeSandbox final : public Sandbox {
 public:
  // A non-zero status makes every later removal (call without a path) or
  // setting (call with a path) fail with it and leave the items unchanged;
  // 0 makes them succeed again.
  void setRemoveStatus(int status);
  void setSetStatus(int status);

  std::vector<FakeSandboxCall> calls() const;
  void clearCalls();

  int setUserStateItem(std::uint32_t userId, std::uint64_t itemType, const std::string& identifier,
                       const std::optional<std::string>& path, std::uint64_t flags) override;
  std::optional<std::string> userStateItem(std::uint32_t userId, std::uint64_t itemType,
                                           const std::string& identifier) const override;
  std::vector<SandboxUserStateItem> userStateItems() const override;

 private:
  mutable std::mutex mutex_;
  int removeStatus_ = 0;
  int setStatus_ = 0;
  std::vector<FakeSandboxCall> calls_;
  LinuxSandbox table_;
};

}  // namespace kestrel::platform
