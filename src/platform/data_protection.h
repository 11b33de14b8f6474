// Data-protection classes of files and directories: a signed 32-bit number per
// item that says when its contents may be read (the numbers belong to the
// callers; this layer only keeps them). On Linux the class lives in the
// extended attribute "trusted.kestrel.protection-class" as a little-endian
// 32-bit integer. On a file system without extended attributes items have no
// class and setting one succeeds without effect.
#pragma once

#include <cstdint>
#include <optional>

namespace kestrel::platform {

inline constexpr const char* kProtectionClassAttribute = "trusted.kestrel.protection-class";

// The class of the open file or directory fd: nullopt when it has none. 0 or an
// errno value (EBADF for a descriptor opened with O_PATH, EINVAL when the
// attribute holds something that is not a class).
int getProtectionClass(int fd, std::optional<std::int32_t>* protectionClass);

// Class 1: the contents can be read only while the device is unlocked.
inline constexpr std::int32_t kProtectionClassCompleteUntilUnlock = 1;

// Changes the class of the open file or directory fd. While the key bag
// reports the device locked, a change into or out of class 1 fails with EPERM;
// every other change goes through (so containers can be made while locked).
int setProtectionClass(int fd, std::int32_t protectionClass);

// Gives a file that was just created, and holds nothing yet, its class. A file
// is born in its class whatever the lock state, so this does not ask the key bag.
int setProtectionClassOfNewFile(int fd, std::int32_t protectionClass);

}  // namespace kestrel::platform
