// The value types of the items of a process-containers request and of its
// reply (packed buffers), shared by the server and by the tools that send the
// requests.
#pragma once

#include <cstdint>

namespace kestrel {

// Request items. A later item of a single kind replaces an earlier one; the
// group kinds accumulate in order.
enum : std::uint16_t {
  kKSTUpcallRequestCodeSignatureId = 0,    // string: the process's signing identifier
  kKSTUpcallRequestContainerId = 1,        // string: its container's, when it differs
  kKSTUpcallRequestApplicationId = 2,      // string: read, not used
  kKSTUpcallRequestPersonaId = 3,          // uint32: the user whose containers are meant
  kKSTUpcallRequestAppGroupId = 4,         // string, repeatable: one app group
  kKSTUpcallRequestContainerType = 5,      // uint32: 0 application, 1 plug-in
  kKSTUpcallRequestSystemContainerId = 6,  // string: the system container
  kKSTUpcallRequestSystemGroupId = 7,      // string, repeatable: one system group
  kKSTUpcallRequestLastValueType = 7,
};

inline constexpr std::uint32_t kKSTUpcallContainerTypeApplication = 0;
inline constexpr std::uint32_t kKSTUpcallContainerTypePlugin = 1;

// Reply items, in the order they come.
enum : std::uint16_t {
  kKSTUpcallReplyHomeDirectory = 100,         // string
  kKSTUpcallReplyDataContainer = 1,           // string
  kKSTUpcallReplyTemporaryDirectory = 2,      // string: the data container's "tmp"
  kKSTUpcallReplyGroupId = 3,                 // string, then its container:
  kKSTUpcallReplyGroupContainer = 4,          // string
  kKSTUpcallReplySystemContainer = 101,       // string
  kKSTUpcallReplySystemGroupId = 102,         // string, then its container:
  kKSTUpcallReplySystemGroupContainer = 103,  // string
  kKSTUpcallReplyStatus = 0,                  // uint32: 1 all found or made and packed, else 0
};

// The routine's return codes (besides the interface generator's, which are negative).
enum : std::int32_t {
  kKSTUpcallAnswered = 0,
  kKSTUpcallUnknownValueType = 4,
  kKSTUpcallBadRequest = 5,
  kKSTUpcallNoMemory = 9,
};

}  // namespace kestrel
