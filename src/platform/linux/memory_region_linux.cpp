// Memory regions on Linux: anonymous private mappings.
#include <sys/mman.h>

#include <cerrno>

#include "platform/memory_region.h"

namespace kestrel::platform {

void* allocateMemoryRegion(std::size_t size) {
  if (size == 0) return nullptr;
  void* region = ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  return region == MAP_FAILED ? nullptr : region;
}

int releaseMemoryRegion(void* address, std::size_t size) {
  return ::munmap(address, size) == 0 ? 0 : errno;
}

}  // namespace kestrel::platform
