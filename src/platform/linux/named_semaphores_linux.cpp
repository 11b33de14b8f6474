#include "platform/linux/named_semaphores_linux.h"

#include <fcntl.h>
#include <semaphore.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>

namespace kestrel::platform {

namespace {

// An open semaphore, closed again when it goes out of scope. The semaphore
// itself lives on until it is unlinked.
class OpenSemaphore {
 public:
  explicit OpenSemaphore(sem_t* sem) : sem_(sem) {}
  ~OpenSemaphore() {
    if (valid()) ::sem_close(sem_);
  }
  OpenSemaphore(const OpenSemaphore&) = delete;
  OpenSemaphore& operator=(const OpenSemaphore&) = delete;

  bool valid() const { return sem_ != SEM_FAILED; }

 private:
  sem_t* sem_;
};

std::uint64_t fnv1a64(std::string_view text) {
  std::uint64_t hash = 14695981039346656037ULL;
  for (const unsigned char c : text) {
    hash ^= c;
    hash *= 1099511628211ULL;
  }
  return hash;
}

}  // namespace

std::string scopedSemaphoreName(const FilesystemRoot& root, std::string_view name) {
  while (!name.empty() && name.front() == '/') name.remove_prefix(1);
  std::string scoped = "/" + std::string(name);
  if (!root.isHostRoot()) {
    char suffix[18];
    std::snprintf(suffix, sizeof suffix, ".%016llx",
                  static_cast<unsigned long long>(fnv1a64(root.path())));
    scoped += suffix;
  }
  return scoped;
}

LinuxNamedSemaphores::LinuxNamedSemaphores(FilesystemRoot root) : root_(std::move(root)) {}

bool LinuxNamedSemaphores::openExisting(const std::string& name) {
  const OpenSemaphore sem(::sem_open(scopedSemaphoreName(root_, name).c_str(), 0));
  return sem.valid();
}

int LinuxNamedSemaphores::create(const std::string& name, unsigned mode, unsigned value) {
  const OpenSemaphore sem(::sem_open(scopedSemaphoreName(root_, name).c_str(), O_CREAT,
                                     static_cast<mode_t>(mode), value));
  return sem.valid() ? 0 : errno;
}

void LinuxNamedSemaphores::remove(const std::string& name) {
  ::sem_unlink(scopedSemaphoreName(root_, name).c_str());
}

}  // namespace kestrel::platform
