// The key bag on Linux. The lock state is published by the session agent in
// <root>/run/kestrel/lock-state; the device's user mode is configured by
// <root>/etc/kestrel/multi-user.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/key_bag.h"
#include "platform/linux/directory_watch_linux.h"
#include "platform/root.h"

namespace kestrel::platform {

class LinuxKeyBag final : public KeyBag {
 public:
  explicit LinuxKeyBag(FilesystemRoot root);
  ~LinuxKeyBag() override;
  LinuxKeyBag(const LinuxKeyBag&) = delete;
  LinuxKeyBag& operator=(const LinuxKeyBag&) = delete;

  // "0" unlocked, "1" locked, another integer as itself; a missing file reads as
  // unlocked, and content that is not an integer as -1. The state read is
  // kept and read again only when an inotify watch on the file's directory
  // saw a change there: asking costs one non-blocking read (it is asked for
  // every protection-class change of a walk), and a write is seen at once.
  int lockState() override;
  // Watches <root>/run/kestrel (made if missing) with inotify; the handler runs on
  // the queue whenever the lock-state file is written, replaced or removed. The
  // watch lasts as long as this object. 0 or an errno.
  int registerLockStatusNotification(std::shared_ptr<DispatchQueue> queue, Work handler) override;
  // Multi-user when <root>/etc/kestrel/multi-user exists, else single-user.
  std::optional<UserTypeInfo> userTypeInfo() override;
  // The multi-user file holds either "logind" (the sessions logind knows, for
  // uids of 501 and above) or a list of decimal uids separated by white space.
  std::optional<std::vector<std::uint32_t>> userSessionIds(std::string* error) override;

 private:
  struct Watch;

  // The lock-state file, read afresh.
  int readLockState() const;

  FilesystemRoot root_;
  std::mutex mutex_;
  std::vector<std::unique_ptr<Watch>> watches_;

  std::mutex stateMutex_;  // guards what follows
  DirectoryChangeWatch stateWatch_;
  bool stateWatched_ = false;  // the watch covered the directory when cachedState_ was read
  int cachedState_ = kUnlocked;
};

// Parses the lock-state file's content as lockState() reads it.
int parseLockState(std::string_view content);

}  // namespace kestrel::platform
