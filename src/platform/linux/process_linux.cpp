#include <execinfo.h>
#include <pthread.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <memory>

#include "platform/process.h"

namespace kestrel::platform {

std::string currentThreadName() {
  char name[64] = {};
  if (pthread_getname_np(pthread_self(), name, sizeof name) != 0) return {};
  return name;
}

void setCurrentThreadName(std::string_view name) {
  std::string truncated(name.substr(0, 15));
  pthread_setname_np(pthread_self(), truncated.c_str());
}

std::vector<std::string> currentCallStackSymbols() {
  void* frames[64];
  const int count = backtrace(frames, 64);
  std::unique_ptr<char*, void (*)(void*)> symbols(backtrace_symbols(frames, count), std::free);
  std::vector<std::string> result;
  if (!symbols) return result;
  result.reserve(static_cast<size_t>(count));
  for (int i = 0; i < count; ++i) result.emplace_back(symbols.get()[i]);
  return result;
}

void exitProcessNow(int status) {
  ::_exit(status);
}

void abortWithCrashMessage(std::string_view message) {
  // write(2) rather than stdio: the process may be in any state.
  std::string text(message);
  text += '\n';
  size_t offset = 0;
  while (offset < text.size()) {
    ssize_t n = ::write(STDERR_FILENO, text.data() + offset, text.size() - offset);
    if (n <= 0) break;
    offset += static_cast<size_t>(n);
  }
  std::abort();
}

}  // namespace kestrel::platform

#include <systemd/sd-daemon.h>

namespace kestrel::platform {

void notifyServiceManagerReady() { sd_notify(0, "READY=1"); }
void notifyServiceManagerStopping() { sd_notify(0, "STOPPING=1"); }

std::chrono::microseconds serviceManagerWatchdogInterval() {
  // Also checks WATCHDOG_PID, so that a child that inherited the environment
  // does not answer for its parent.
  uint64_t usec = 0;
  if (sd_watchdog_enabled(0, &usec) <= 0) return std::chrono::microseconds(0);
  return std::chrono::microseconds(usec);
}

void notifyServiceManagerAlive() { sd_notify(0, "WATCHDOG=1"); }

}  // namespace kestrel::platform
