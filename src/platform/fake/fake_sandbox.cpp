#include "platform/fake/fake_sandbox.h"

namespace kestrel::platform {

void FakeSandbox::setRemoveStatus(int status) {
  std::lock_guard lock(mutex_);
  removeStatus_ = status;
}

void FakeSandbox::setSetStatus(int status) {
  std::lock_guard lock(mutex_);
  setStatus_ = status;
}

std::vector<FakeSandboxCall> FakeSandbox::calls() const {
  std::lock_guard lock(mutex_);
  return calls_;
}

void FakeSandbox::clearCalls() {
  std::lock_guard lock(mutex_);
  calls_.clear();
}

int FakeSandbox::setUserStateItem(std::uint32_t userId, std::uint64_t itemType,
                                  const std::string& identifier,
                                  const std::optional<std::string>& path, std::uint64_t flags) {
  std::lock_guard lock(mutex_);
  calls_.push_back({userId, itemType, identifier, path, flags});
  const int failure = path ? setStatus_ : removeStatus_;
  if (failure != 0) return failure;
  return table_.setUserStateItem(userId, itemType, identifier, path, flags);
}

std::optional<std::string> FakeSandbox::userStateItem(std::uint32_t userId, std::uint64_t itemType,
                                                      const std::string& identifier) const {
  return table_.userStateItem(userId, itemType, identifier);
}

std::vector<SandboxUserStateItem> FakeSandbox::userStateItems() const {
  return table_.userStateItems();
}

}  // namespace kestrel::platform
