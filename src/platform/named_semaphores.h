// POSIX named semaphores, used only as marks that live until the system
// restarts. Beneath a root other than "/" the names are scoped to that root so
// that scratch roots never see each other's marks.
#pragma once

#include <string>

namespace kestrel::platform {

class NamedSemaphores {
 public:
  virtual ~NamedSemaphores() = default;
  // Opens the semaphore without creating it (and closes it again); false when it does not exist.
  virtual bool openExisting(const std::string& name) = 0;
  // Creates it with O_CREAT, the mode and the initial value; 0 or the errno of the failure.
  virtual int create(const std::string& name, unsigned mode, unsigned value) = 0;
  // Removes it, as a restart of the system would.
  virtual void remove(const std::string& name) = 0;
};

}  // namespace kestrel::platform
