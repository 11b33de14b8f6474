// A tmpfs mounted for one test: another file system, for moves that cannot be
// renames, and a mount point, for a directory that no removal can take away.
// The test's process first moves into a mount namespace of its own, so that
// nothing it mounts is seen outside it or outlives it.
#pragma once

#include <cstddef>
#include <string>

namespace kestrel::testing {

class TmpfsMount {
 public:
  // Mounts a tmpfs (of at most sizeBytes, when given) at path, making path
  // first when it is missing. mounted() tells whether that worked.
  explicit TmpfsMount(std::string path, std::size_t sizeBytes = 0);
  ~TmpfsMount();
  TmpfsMount(const TmpfsMount&) = delete;
  TmpfsMount& operator=(const TmpfsMount&) = delete;

  bool mounted() const { return mounted_; }
  const std::string& error() const { return error_; }
  // Unmounts now, wherever the mount point was moved to meanwhile (lazily:
  // whatever still uses it keeps it until done).
  void unmount();

 private:
  std::string path_;
  std::string error_;
  std::string source_;
  bool mounted_ = false;
};

}  // namespace kestrel::testing
