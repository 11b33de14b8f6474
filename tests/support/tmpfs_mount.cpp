#include "support/tmpfs_mount.h"

#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>

namespace kestrel::testing {

namespace {

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

// Where the file system with that device is mounted now (the test may have
// renamed its mount point since), from /proc/self/mountinfo.
std::string mountPointOf(dev_t device) {
  const std::string wanted = std::to_string(major(device)) + ":" + std::to_string(minor(device));
  std::ifstream mountinfo("/proc/self/mountinfo");
  for (std::string line; std::getline(mountinfo, line);) {
    std::istringstream fields(line);
    std::string id, parent, numbers, root, point;
    fields >> id >> parent >> numbers >> root >> point;
    if (numbers != wanted) continue;
    // Spaces and the like are octal escapes.
    std::string unescaped;
    for (std::size_t i = 0; i < point.size(); ++i) {
      if (point[i] == '\\' && i + 3 < point.size()) {
        unescaped += static_cast<char>(std::stoi(point.substr(i + 1, 3), nullptr, 8));
        i += 3;
      } else {
        unescaped += point[i];
      }
    }
    return unescaped;
  }
  return {};
}

}  // namespace

TmpfsMount::TmpfsMount(std::string path, std::size_t sizeBytes) : path_(std::move(path)) {
  if (const int error = ownMountNamespace(); error != 0) {
    error_ = std::string("unshare: ") + std::strerror(error);
    return;
  }
  std::error_code ec;
  std::filesystem::create_directories(path_, ec);
  const std::string options = sizeBytes != 0 ? "size=" + std::to_string(sizeBytes) : "";
  if (::mount("kestrel-test", path_.c_str(), "tmpfs", 0, options.c_str()) != 0) {
    error_ = std::string("mount: ") + std::strerror(errno);
    return;
  }
  struct stat st {};
  if (::stat(path_.c_str(), &st) == 0) device_ = st.st_dev;
  mounted_ = true;
}

TmpfsMount::~TmpfsMount() {
  unmount();
}

void TmpfsMount::unmount() {
  if (!mounted_) return;
  mounted_ = false;
  const std::string point = mountPointOf(device_);
  if (!point.empty()) ::umount2(point.c_str(), MNT_DETACH);
}

}  // namespace kestrel::testing
