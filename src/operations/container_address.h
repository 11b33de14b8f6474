// The preamble the operations on one existing container share: the address
// (user, internal UUID, identifier, class) must name a container, and the
// cache must hold it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "daemon/errors.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/metadata.h"

namespace kestrel {

// Error 11 (logged, on behalf of `function`) when the address has no UUID or
// its class lies outside 1..13; nothing when it can name a container.
KSTErrorRef KSTInvalidContainerAddress(const char* function, std::uint32_t userId,
                                       const std::optional<platform::Uuid>& uuid,
                                       KSTContainerClass containerClass);

// The cached container of the address, or nothing with error 21 (logged, on
// behalf of `function`).
KSTMetadataRef KSTCachedContainer(const char* function, std::uint32_t userId,
                                  const std::string& uuidString,
                                  const std::optional<std::string>& identifier,
                                  KSTContainerClass containerClass, KSTErrorRef* error);

}  // namespace kestrel
