#include "platform/root.h"

#include <cstdlib>

namespace kestrel::platform {

FilesystemRoot::FilesystemRoot(std::string root) : root_(std::move(root)) {
  if (root_.empty()) root_ = "/";
  while (root_.size() > 1 && root_.back() == '/') root_.pop_back();
}

FilesystemRoot FilesystemRoot::fromEnvironment() {
  const char* env = std::getenv("KESTREL_ROOT");
  return FilesystemRoot(env != nullptr ? env : "/");
}

std::string FilesystemRoot::resolve(std::string_view systemPath) const {
  while (!systemPath.empty() && systemPath.front() == '/') systemPath.remove_prefix(1);
  if (isHostRoot()) return "/" + std::string(systemPath);
  if (systemPath.empty()) return root_;
  return root_ + "/" + std::string(systemPath);
}

}  // namespace kestrel::platform
