#include "platform/data_protection.h"

#include <sys/xattr.h>

#include <array>
#include <cerrno>

#include "platform/key_bag.h"
#include "platform/services.h"

namespace kestrel::platform {

namespace {

bool deviceIsLocked() {
  const auto& keyBag = services().keyBag;
  return keyBag != nullptr && keyBag->lockState() == KeyBag::kLocked;
}

int writeClass(int fd, std::int32_t protectionClass) {
  const auto value = static_cast<std::uint32_t>(protectionClass);
  const std::array<unsigned char, 4> bytes{
      static_cast<unsigned char>(value), static_cast<unsigned char>(value >> 8),
      static_cast<unsigned char>(value >> 16), static_cast<unsigned char>(value >> 24)};
  if (::fsetxattr(fd, kProtectionClassAttribute, bytes.data(), bytes.size(), 0) == 0) return 0;
  // A file system without extended attributes has no classes to set.
  return errno == ENOTSUP ? 0 : errno;
}

}  // namespace

int getProtectionClass(int fd, std::optional<std::int32_t>* protectionClass) {
  protectionClass->reset();
  std::array<unsigned char, 4> bytes{};
  const ssize_t size = ::fgetxattr(fd, kProtectionClassAttribute, bytes.data(), bytes.size());
  if (size < 0) {
    if (errno == ENODATA || errno == ENOTSUP) return 0;
    return errno == ERANGE ? EINVAL : errno;
  }
  if (static_cast<std::size_t>(size) != bytes.size()) return EINVAL;
  const std::uint32_t value =
      static_cast<std::uint32_t>(bytes[0]) | static_cast<std::uint32_t>(bytes[1]) << 8 |
      static_cast<std::uint32_t>(bytes[2]) << 16 | static_cast<std::uint32_t>(bytes[3]) << 24;
  *protectionClass = static_cast<std::int32_t>(value);
  return 0;
}

int setProtectionClass(int fd, std::int32_t protectionClass) {
  if (deviceIsLocked()) {
    // Only class 1 has keys that go away while locked: an item cannot enter
    // or leave it then. Every other change goes through.
    if (protectionClass == kProtectionClassCompleteUntilUnlock) return EPERM;
    std::optional<std::int32_t> current;
    if (const int error = getProtectionClass(fd, &current); error != 0) return error;
    if (current == kProtectionClassCompleteUntilUnlock) return EPERM;
  }
  return writeClass(fd, protectionClass);
}

int setProtectionClassOfNewFile(int fd, std::int32_t protectionClass) {
  return writeClass(fd, protectionClass);
}

}  // namespace kestrel::platform
