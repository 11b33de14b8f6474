// The sandbox's per-user mapping of (user, item type, identifier) to a
// container's path. Operations that move a container to a new path or retire it
// keep the mapping in step: replace and UUID regeneration with the new path,
// staging for deletion with none.
#include <cerrno>
#include <cstdint>
#include <optional>
#include <string>

#include "daemon/client_connection.h"
#include "daemon/log.h"
#include "platform/services.h"

namespace kestrel {

namespace {

// The sandbox's item types.
constexpr std::uint64_t kSandboxItemTypeData = 1;
constexpr std::uint64_t kSandboxItemTypeAppGroup = 2;
constexpr std::uint64_t kSandboxItemTypeSystem = 4;
constexpr std::uint64_t kSandboxItemTypeSystemGroup = 8;

struct SandboxItemTarget {
  std::uint64_t itemType;
  std::uint32_t userId;
};

// The item type of a class and the user the sandbox keeps it under: system
// containers belong to user 0 in the sandbox's table, whatever user owns them.
std::optional<SandboxItemTarget> sandboxItemTarget(KSTContainerClass containerClass,
                                                   std::uint32_t userId) {
  switch (containerClass) {
    case kKSTContainerClassDataApplication:
    case kKSTContainerClassDataVantlerPlugin:
    case kKSTContainerClassDataVPNPlugin:
    case kKSTContainerClassDataVexelService:
    case kKSTContainerClassDataInternalDaemon:
    case kKSTContainerClassDataTempDir:
      return SandboxItemTarget{kSandboxItemTypeData, userId};
    case kKSTContainerClassSharedAppGroup:
      return SandboxItemTarget{kSandboxItemTypeAppGroup, userId};
    case kKSTContainerClassDataSystem:
      return SandboxItemTarget{kSandboxItemTypeSystem, kKSTRootUserId};
    case kKSTContainerClassSharedSystemGroup:
      return SandboxItemTarget{kSandboxItemTypeSystemGroup, kKSTRootUserId};
    default:
      return std::nullopt;
  }
}

int setSandboxUserStateItem(const SandboxItemTarget& target, const std::string& identifier,
                            const std::optional<std::string>& path) {
  const auto& sandbox = platform::services().sandbox;
  if (!sandbox) return ENOSYS;
  return sandbox->setUserStateItem(target.userId, target.itemType, identifier, path, 0);
}

}  // namespace

bool KSTClientConnection::_setSandboxContainerMappingForUser(std::uint32_t userId,
                                                             const std::string& identifier,
                                                             KSTContainerClass containerClass,
                                                             const std::optional<KSTFileURL>& url) {
  if (KSTIsBundleClass(containerClass)) return true;

  const std::optional<SandboxItemTarget> target = sandboxItemTarget(containerClass, userId);
  if (!target) {
    KSTLog(kLogError, "Unsupported class for setting sandbox container mapping: %llu",
           containerClass);
    return false;
  }

  // Remove the current item first: when that fails the new one is not set, so
  // the sandbox never holds two paths for one identifier.
  const int removeStatus = setSandboxUserStateItem(*target, identifier, std::nullopt);
  if (removeStatus != 0) {
    KSTLog(kLogError,
           "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, "
           "path: %s : %d",
           target->userId, target->itemType, identifier, containerClass, nullptr, removeStatus);
    return false;
  }
  if (!url) return true;

  const std::string path = url->fileSystemRepresentation();
  const int setStatus = setSandboxUserStateItem(*target, identifier, path);
  if (setStatus != 0) {
    KSTLog(kLogError,
           "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, "
           "path: %s : %d",
           target->userId, target->itemType, identifier, containerClass, path, setStatus);
    return false;
  }
  return true;
}

}  // namespace kestrel
