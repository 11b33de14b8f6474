#pragma once

#include <memory>

#include "platform/logging.h"
#include "platform/root.h"

namespace kestrel::platform {

std::shared_ptr<Logging> makeLinuxLogging(const FilesystemRoot& root);

}  // namespace kestrel::platform
