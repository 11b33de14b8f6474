// Facts about the device the daemon runs on.
#pragma once

#include <string>

namespace kestrel::platform {

class DeviceInfo {
 public:
  virtual ~DeviceInfo() = default;
  // The device query "InternalBuild".
  virtual bool isInternalBuild() const = 0;
  // The system's build version; "Unknown" when it cannot be told.
  virtual std::string buildVersion() const = 0;
};

}  // namespace kestrel::platform
