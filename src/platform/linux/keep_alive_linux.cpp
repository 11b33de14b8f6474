#include "platform/linux/keep_alive_linux.h"

#include <systemd/sd-daemon.h>

#include <cstdio>
#include <cstdlib>

namespace kestrel::platform {

namespace {

bool runningUnderServiceManager() {
  const char* socket = std::getenv("NOTIFY_SOCKET");
  return socket != nullptr && socket[0] != '\0';
}

}  // namespace

LinuxKeepAlive::LinuxKeepAlive() : notify_(runningUnderServiceManager()) {}

void LinuxKeepAlive::begin() {
  open_.fetch_add(1, std::memory_order_acq_rel);
  report();
}

void LinuxKeepAlive::end() {
  std::uint64_t current = open_.load(std::memory_order_acquire);
  do {
    if (current == 0) {
      std::fputs("kestreld: keep-alive transaction ended without one open\n", stderr);
      std::abort();
    }
  } while (!open_.compare_exchange_weak(current, current - 1, std::memory_order_acq_rel));
  report();
}

std::uint64_t LinuxKeepAlive::openTransactions() const {
  return open_.load(std::memory_order_acquire);
}

// The count is read under the lock, so whichever change reports last reports the
// current count, and the status line never ends up stale.
void LinuxKeepAlive::report() {
  if (!notify_) return;
  std::lock_guard lock(reportMutex_);
  const unsigned long long n = open_.load(std::memory_order_acquire);
  ::sd_notifyf(0, "STATUS=%llu keep-alive transaction%s open", n, n == 1 ? "" : "s");
}

}  // namespace kestrel::platform
