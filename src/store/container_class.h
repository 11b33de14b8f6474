// Container classes: each real class (1 to 13) has a relative path that is
// both its directory below its base directory and its name in log texts.
// 0 and 14 are bounds that every operation rejects.
#pragma once

#include <cstdint>
#include <string_view>

namespace kestrel {

using KSTContainerClass = std::uint64_t;

enum : KSTContainerClass {
  kKSTContainerClassUndefined = 0,
  kKSTContainerClassBundleApplication = 1,
  kKSTContainerClassDataApplication = 2,
  kKSTContainerClassBundleVantlerPlugin = 3,
  kKSTContainerClassDataVantlerPlugin = 4,
  kKSTContainerClassBundleVPNPlugin = 5,
  kKSTContainerClassDataVPNPlugin = 6,
  kKSTContainerClassSharedAppGroup = 7,
  kKSTContainerClassBundleFramework = 8,
  kKSTContainerClassDataVexelService = 9,
  kKSTContainerClassDataInternalDaemon = 10,
  kKSTContainerClassDataTempDir = 11,
  kKSTContainerClassDataSystem = 12,
  kKSTContainerClassSharedSystemGroup = 13,
  kKSTContainerClassMax = 14,
};

// Fixed user ids.
inline constexpr std::uint32_t kKSTRootUserId = 0;
inline constexpr std::uint32_t kKSTInstallerUserId = 33;
inline constexpr std::uint32_t kKSTSystemContainerUserId = 499;
inline constexpr std::uint32_t kKSTFirstMobileUserId = 501;
// In a request, user 1 stands for the current mobile user.
inline constexpr std::uint32_t kKSTCurrentMobileUserAlias = 1;

// "Bundle/Application", ...; "Undefined" and "MAX" for the bounds, "" beyond.
std::string_view KSTContainerClassPath(KSTContainerClass containerClass);

constexpr bool KSTIsValidContainerClass(KSTContainerClass c) { return c >= 1 && c <= 13; }
constexpr bool KSTIsBundleClass(KSTContainerClass c) { return c == 1 || c == 3 || c == 5 || c == 8; }
constexpr bool KSTIsSystemClass(KSTContainerClass c) { return c == 12 || c == 13; }
constexpr bool KSTIsPerUserClass(KSTContainerClass c) {
  return c == 2 || c == 4 || c == 6 || c == 7 || c == 9 || c == 10 || c == 11;
}

// The one rule on which user may own which class: 33 with a bundle class, 499
// with class 12 or 13, 501 and above with a per-user class.
bool KSTUserIdIsValidForClass(KSTContainerClass containerClass, std::uint32_t userId);

}  // namespace kestrel
