#include "platform/linux/sandbox_linux.h"

#include <cerrno>

namespace kestrel::platform {

namespace {

bool hasEmbeddedNul(const std::string& text) {
  return text.find('\0') != std::string::npos;
}

}  // namespace

int LinuxSandbox::setUserStateItem(std::uint32_t userId, std::uint64_t itemType,
                                   const std::string& identifier,
                                   const std::optional<std::string>& path, std::uint64_t flags) {
  if (flags != 0 || hasEmbeddedNul(identifier) || (path && hasEmbeddedNul(*path))) return EINVAL;
  std::lock_guard lock(mutex_);
  Key key{userId, itemType, identifier};
  if (path) {
    items_[std::move(key)] = *path;
  } else {
    items_.erase(key);
  }
  return 0;
}

std::optional<std::string> LinuxSandbox::userStateItem(std::uint32_t userId, std::uint64_t itemType,
                                                       const std::string& identifier) const {
  std::lock_guard lock(mutex_);
  const auto found = items_.find(Key{userId, itemType, identifier});
  if (found == items_.end()) return std::nullopt;
  return found->second;
}

std::vector<SandboxUserStateItem> LinuxSandbox::userStateItems() const {
  std::lock_guard lock(mutex_);
  std::vector<SandboxUserStateItem> result;
  result.reserve(items_.size());
  for (const auto& [key, path] : items_) {
    result.push_back({std::get<0>(key), std::get<1>(key), std::get<2>(key), path});
  }
  return result;
}

}  // namespace kestrel::platform
