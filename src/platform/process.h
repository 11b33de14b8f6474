// Facts about the running process and its threads, and how it ends when it must.
#pragma once

#include <chrono>
#include <string>
#include <string_view>
#include <vector>

namespace kestrel::platform {

// The calling thread's name; empty when it has none.
std::string currentThreadName();
void setCurrentThreadName(std::string_view name);

// The call stack of the calling thread, one symbolised frame per entry.
std::vector<std::string> currentCallStackSymbols();

// Leaves the message for whoever examines the crash (standard error, which the
// service manager keeps in its journal) and aborts the process.
[[noreturn]] void abortWithCrashMessage(std::string_view message);

// Ends the process at once with the status, as if it had been killed: no
// destructor or exit handler runs, and other threads stop where they are.
[[noreturn]] void exitProcessNow(int status);

}  // namespace kestrel::platform

namespace kestrel::platform {

// Tells the service manager, when there is one, that the daemon is ready to
// serve (READY=1), or that it is stopping (STOPPING=1).
void notifyServiceManagerReady();
void notifyServiceManagerStopping();

// The time within which the service manager wants to hear that the daemon is
// alive before it counts the daemon as hung and restarts it (systemd's
// WatchdogSec=); zero when nothing watches the daemon.
std::chrono::microseconds serviceManagerWatchdogInterval();
// Tells the service manager that the daemon is alive (WATCHDOG=1).
void notifyServiceManagerAlive();

}  // namespace kestrel::platform
