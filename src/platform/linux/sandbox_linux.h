// The sandbox's container mapping on Linux. Linux has no kernel sandbox that
// consults such a table, so the items live in memory, in this process, for as
// long as it runs; the process-containers server may read them back. Nothing
// persists across restarts: the daemon sets the items again as containers move.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "platform/sandbox.h"

namespace kestrel::platform {

class LinuxSandbox final : public Sandbox {
 public:
  // Accepts every item; EINVAL only for flags other than 0 and for an
  // identifier or path with an embedded NUL, which the sandbox's C strings
  // cannot carry.
  int setUserStateItem(std::uint32_t userId, std::uint64_t itemType, const std::string& identifier,
                       const std::optional<std::string>& path, std::uint64_t flags) override;
  std::optional<std::string> userStateItem(std::uint32_t userId, std::uint64_t itemType,
                                           const std::string& identifier) const override;
  std::vector<SandboxUserStateItem> userStateItems() const override;

 private:
  using Key = std::tuple<std::uint32_t, std::uint64_t, std::string>;

  mutable std::mutex mutex_;
  std::map<Key, std::string> items_;
};

}  // namespace kestrel::platform
