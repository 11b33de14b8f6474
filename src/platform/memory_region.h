// Whole-page memory regions of the process, as a kernel hands out for
// out-of-line message data: made zero-filled, released by address and size.
#pragma once

#include <cstddef>

namespace kestrel::platform {

// A new region of at least size bytes; nullptr when none can be had.
void* allocateMemoryRegion(std::size_t size);
// 0, or the errno of the failure (a region that is not one, a size of 0).
int releaseMemoryRegion(void* address, std::size_t size);

}  // namespace kestrel::platform
