// Tells, without a system call per file, whether a directory or anything in
// it changed: an inotify watch on the directory and on each directory on the
// way to it, so that a replaced, renamed or newly made directory is noticed
// too. Cheap to ask (one non-blocking read); not thread-safe, callers
// serialise.
//
// What inotify cannot see is not covered: a registry file changed through a
// hard link in another directory is noticed only at the next change seen here.
#pragma once

#include <map>
#include <string>

#include "platform/unique_fd.h"

namespace kestrel::platform {

class DirectoryChangeWatch {
 public:
  // Watches `directory` and its ancestors up to and including `top` (a prefix
  // of it, such as the filesystem root the daemon runs on).
  DirectoryChangeWatch(std::string directory, std::string top);

  // (Re)places the watches as the paths are now. False when they could not
  // all be placed: the caller then checks for changes by other means.
  bool arm();
  // True when something changed since the last arm() or changed(); drains
  // what was reported. False as well when not armed.
  bool changed();

 private:
  const std::string directory_;
  const std::string top_;
  UniqueFd fd_;
  // Watch descriptor -> the one entry name that matters in it ("" for the
  // directory itself, where every entry matters).
  std::map<int, std::string> watches_;
};

}  // namespace kestrel::platform
