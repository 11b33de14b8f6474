#include "platform/crash_point.h"

#if KESTREL_CRASH_POINTS

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <string>

namespace kestrel::platform {

namespace {

// The point to crash at and on which pass, read once from the environment.
struct CrashTarget {
  std::string name;
  long pass = 1;
  std::atomic<long> seen{0};

  CrashTarget() {
    const char* value = std::getenv("KESTREL_CRASH_AT");
    if (value == nullptr) return;
    name = value;
    if (const auto at = name.find('@'); at != std::string::npos) {
      pass = std::strtol(name.c_str() + at + 1, nullptr, 10);
      name.resize(at);
    }
  }
};

CrashTarget& target() {
  static CrashTarget crashTarget;
  return crashTarget;
}

}  // namespace

void crashPoint(const char* name) {
  CrashTarget& crash = target();
  if (crash.name.empty() || crash.name != name) return;
  if (crash.seen.fetch_add(1) + 1 != crash.pass) return;
  static constexpr char kNote[] = "kestreld: crash point reached\n";
  [[maybe_unused]] const ssize_t written = ::write(STDERR_FILENO, kNote, sizeof kNote - 1);
  ::kill(::getpid(), SIGKILL);
}

}  // namespace kestrel::platform

#endif
