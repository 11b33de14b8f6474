// A fresh filesystem root for one test, seeded with the accounts the daemon
// expects, removed again when the test ends (set KESTREL_KEEP_SCRATCH=1 to keep it).
#pragma once

#include <string>
#include <string_view>

#include "platform/root.h"

namespace kestrel::testing {

class ScratchRoot {
 public:
  ScratchRoot();
  ~ScratchRoot();
  ScratchRoot(const ScratchRoot&) = delete;
  ScratchRoot& operator=(const ScratchRoot&) = delete;

  const std::string& path() const { return path_; }
  platform::FilesystemRoot root() const { return platform::FilesystemRoot(path_); }
  // A system path ("/private/var/...") beneath this root.
  std::string resolve(std::string_view systemPath) const { return root().resolve(systemPath); }

  // Writes a file beneath the root, making its parent directories.
  void writeFile(std::string_view systemPath, std::string_view contents) const;
  std::string readFile(std::string_view systemPath) const;
  bool exists(std::string_view systemPath) const;

 private:
  std::string path_;
  // Where the roots of this process's death-test children go, if this root
  // is the one that removes them.
  std::string childRoots_;
};

}  // namespace kestrel::testing
