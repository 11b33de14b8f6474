// Device facts on Linux: the internal-build marker beneath the root and the
// build version from the root's os-release file.
#pragma once

#include <map>
#include <string>
#include <string_view>

#include "platform/device_info.h"
#include "platform/root.h"

namespace kestrel::platform {

class LinuxDeviceInfo final : public DeviceInfo {
 public:
  explicit LinuxDeviceInfo(FilesystemRoot root);

  // True when <root>/etc/kestrel/internal-build exists, whatever its type.
  bool isInternalBuild() const override;
  // BUILD_ID from <root>/etc/os-release, else VERSION_ID, else "Unknown".
  std::string buildVersion() const override;

 private:
  FilesystemRoot root_;
};

// The assignments of an os-release file: shell-style KEY=value lines, values
// optionally single- or double-quoted, '#' comments and blank lines skipped.
std::map<std::string, std::string> parseOsRelease(std::string_view text);

}  // namespace kestrel::platform
