#pragma once

#include <memory>

#include "platform/root.h"
#include "platform/upcall_channel.h"

namespace kestrel::platform {

std::shared_ptr<UpcallChannel> makeLinuxUpcallChannel(const FilesystemRoot& root);

}  // namespace kestrel::platform
