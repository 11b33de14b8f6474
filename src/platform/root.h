// Every absolute path the system names is resolved beneath one root directory,
// taken from KESTREL_ROOT (default "/"). Tests, benchmarks and the demo each run
// on a scratch root of their own.
#pragma once

#include <string>
#include <string_view>

namespace kestrel::platform {

class FilesystemRoot {
 public:
  FilesystemRoot() : FilesystemRoot("/") {}
  explicit FilesystemRoot(std::string root);

  // The root named by KESTREL_ROOT, or "/" when it is unset or empty.
  static FilesystemRoot fromEnvironment();

  // The root directory itself, without a trailing slash unless it is "/".
  const std::string& path() const { return root_; }
  bool isHostRoot() const { return root_ == "/"; }

  // "/private/var/containers" beneath the root. A relative path is taken as
  // relative to the root too.
  std::string resolve(std::string_view systemPath) const;

 private:
  std::string root_;
};

}  // namespace kestrel::platform
