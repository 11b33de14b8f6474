#include "support/tmpfs_mount.h"

#include <sched.h>
#include <sys/mount.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>

namespace kestrel::testing {

namespace {

constexpr const char* kSource = "kestrel-test";

// 0, or the errno of moving this process into a private mount namespace.
int ownMountNamespace() {
  static std::once_flag once;
  static int result = 0;
  std::call_once(once, [] {
    if (::unshare(CLONE_NEWNS) != 0 ||
        ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
      result = errno;
    }
  });
  return result;
}

}  // namespace

TmpfsMount::TmpfsMount(std::string path, std::size_t sizeBytes) : path_(std::move(path)) {
  if (const int error = ownMountNamespace(); error != 0) {
    error_ = std::string("unshare: ") + std::strerror(error);
    return;
  }
  std::error_code ec;
  std::filesystem::create_directories(path_, ec);
  // The mount's source names it, wherever the test moves its mount point.
  source_ = std::string(kSource) + "-" + std::to_string(reinterpret_cast<std::uintptr_t>(this));
  const std::string options = sizeBytes != 0 ? "size=" + std::to_string(sizeBytes) : "";
  if (::mount(source_.c_str(), path_.c_str(), "tmpfs", 0, options.c_str()) != 0) {
    error_ = std::string("mount: ") + std::strerror(errno);
    return;
  }
  mounted_ = true;
}

TmpfsMount::~TmpfsMount() {
  unmount();
}

void TmpfsMount::unmount() {
  if (!mounted_) return;
  mounted_ = false;
  std::ifstream mounts("/proc/self/mounts");
  for (std::string line; std::getline(mounts, line);) {
    std::istringstream fields(line);
    std::string source, point;
    fields >> source >> point;
    if (source == source_) ::umount2(point.c_str(), MNT_DETACH);
  }
}

}  // namespace kestrel::testing
