// POSIX named semaphores on Linux, scoped to the filesystem root.
#pragma once

#include <string>
#include <string_view>

#include "platform/named_semaphores.h"
#include "platform/root.h"

namespace kestrel::platform {

class LinuxNamedSemaphores final : public NamedSemaphores {
 public:
  explicit LinuxNamedSemaphores(FilesystemRoot root);

  bool openExisting(const std::string& name) override;
  int create(const std::string& name, unsigned mode, unsigned value) override;
  void remove(const std::string& name) override;

 private:
  FilesystemRoot root_;
};

// The system-wide name of a mark: "/<name>" on the host root, and
// "/<name>.<16 hex digits of the 64-bit FNV-1a hash of the root path>" beneath
// any other root.
std::string scopedSemaphoreName(const FilesystemRoot& root, std::string_view name);

}  // namespace kestrel::platform
