#include "platform/linux/directory_watch_linux.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstring>
#include <filesystem>
#include <utility>
#include <vector>

namespace kestrel::platform {

namespace {

constexpr std::uint32_t kDirectoryEvents = IN_ATTRIB | IN_CLOSE_WRITE | IN_MODIFY | IN_CREATE |
                                           IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                                           IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
// In an ancestor only the entry leading to the directory matters.
constexpr std::uint32_t kAncestorEvents = IN_ATTRIB | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                          IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

}  // namespace

DirectoryChangeWatch::DirectoryChangeWatch(std::string directory, std::string top)
    : directory_(std::move(directory)), top_(std::move(top)) {}

bool DirectoryChangeWatch::arm() {
  if (!fd_) fd_.reset(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!fd_) return false;
  std::map<int, std::string> placed;
  bool complete = true;
  // The directory, then each ancestor with the name of the step below it.
  std::filesystem::path path(directory_);
  std::string child;
  for (;;) {
    const int wd = ::inotify_add_watch(fd_.get(), path.c_str(),
                                       child.empty() ? kDirectoryEvents : kAncestorEvents);
    if (wd >= 0) {
      placed[wd] = child;
    } else if (errno != ENOENT && errno != ENOTDIR) {
      complete = false;  // out of watches, or not allowed
    }
    // A missing directory is covered by its parent's watch, which sees it made.
    if (path.string().size() <= top_.size() || !path.has_parent_path() ||
        path.parent_path() == path) {
      break;
    }
    child = path.filename().string();
    path = path.parent_path();
  }
  for (const auto& [wd, name] : watches_) {
    if (placed.count(wd) == 0) ::inotify_rm_watch(fd_.get(), wd);
  }
  watches_ = std::move(placed);
  // Events of the watches as they were belong to the past.
  changed();
  return complete && !watches_.empty();
}

bool DirectoryChangeWatch::changed() {
  if (!fd_) return false;
  bool any = false;
  alignas(inotify_event) char buffer[4096];
  for (;;) {
    const ssize_t length = ::read(fd_.get(), buffer, sizeof buffer);
    if (length <= 0) break;
    for (std::size_t offset = 0; offset < static_cast<std::size_t>(length);) {
      inotify_event event;
      std::memcpy(&event, buffer + offset, sizeof event);
      const char* name = buffer + offset + sizeof event;
      offset += sizeof event + event.len;
      if (event.mask & (IN_Q_OVERFLOW | IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
        any = true;
        continue;
      }
      const auto watch = watches_.find(event.wd);
      if (watch == watches_.end()) continue;  // a watch already given up
      if (watch->second.empty() || (event.len > 0 && watch->second == name)) any = true;
    }
  }
  return any;
}

}  // namespace kestrel::platform
