// One disk-usage walk of a directory, exactly as the daemon measures a
// container, printing the bytes it counted. bench/disk_usage.sh times it
// against `du -sxB1` over the same tree, each in a process of its own.
//
//   kestrel_disk_usage_walk <directory>
#include <cstdio>

#include "store/file_manager.h"

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: %s <directory>\n", argv[0]);
    return 2;
  }
  const std::uint64_t total =
      kestrel::KSTFileManager::defaultManager().diskUsageForURL(kestrel::KSTFileURL(argv[1], true));
  std::printf("%llu\n", static_cast<unsigned long long>(total));
  return 0;
}
