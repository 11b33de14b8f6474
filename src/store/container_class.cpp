#include "store/container_class.h"

namespace kestrel {

std::string_view KSTContainerClassPath(KSTContainerClass containerClass) {
  static constexpr std::string_view kPaths[] = {
      "Undefined",           "Bundle/Application", "Data/Application",   "Bundle/VantlerPlugin",
      "Data/VantlerPlugin",  "Bundle/VPNPlugin",   "Data/VPNPlugin",     "Shared/AppGroup",
      "Bundle/Framework",    "Data/VexelService",  "Data/InternalDaemon", "Data/TempDir",
      "Data/System",         "Shared/SystemGroup", "MAX",
  };
  return containerClass < std::size(kPaths) ? kPaths[containerClass] : std::string_view();
}

bool KSTUserIdIsValidForClass(KSTContainerClass containerClass, std::uint32_t userId) {
  if (KSTIsBundleClass(containerClass)) return userId == kKSTInstallerUserId;
  if (KSTIsSystemClass(containerClass)) return userId == kKSTSystemContainerUserId;
  if (KSTIsPerUserClass(containerClass)) return userId >= kKSTFirstMobileUserId;
  return false;
}

}  // namespace kestrel
