// The sandbox's per-user table of container locations: one item per (user,
// item type, identifier) that maps to a container's path. The daemon sets an
// item when a container moves and removes it when the container is retired.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace kestrel::platform {

struct SandboxUserStateItem {
  std::uint32_t userId = 0;
  std::uint64_t itemType = 0;
  std::string identifier;
  std::string path;

  friend bool operator==(const SandboxUserStateItem&, const SandboxUserStateItem&) = default;
};

class Sandbox {
 public:
  virtual ~Sandbox() = default;

  // Sets the item of (user, item type, identifier) to the path, or removes it
  // when there is no path (removing an item that does not exist succeeds).
  // 0 on success, else a non-zero status.
  virtual int setUserStateItem(std::uint32_t userId, std::uint64_t itemType,
                               const std::string& identifier,
                               const std::optional<std::string>& path, std::uint64_t flags) = 0;

  // Reading back, for the process-containers server, tests and inspection: the
  // path held for (user, item type, identifier), or nullopt when there is none.
  virtual std::optional<std::string> userStateItem(std::uint32_t userId, std::uint64_t itemType,
                                                   const std::string& identifier) const = 0;
  // Every item held, ordered by user, item type and identifier.
  virtual std::vector<SandboxUserStateItem> userStateItems() const = 0;
};

}  // namespace kestrel::platform
