// Crash injection, for proving that what the daemon writes survives a crash at
// any step. Only builds configured with KESTREL_CRASH_POINTS=ON (never a
// release build) have it; everywhere else KST_CRASH_POINT compiles to nothing.
//
//   KST_CRASH_POINT("replace.old-parked");
//
// When the environment variable KESTREL_CRASH_AT names the point ("name", or
// "name@N" for its N-th pass, counted from 1), the process is killed there on
// the spot (SIGKILL): no destructor runs, no buffer is flushed, nothing is
// sent, as when the machine loses the process.
#pragma once

#if KESTREL_CRASH_POINTS

namespace kestrel::platform {
void crashPoint(const char* name);
}  // namespace kestrel::platform

#define KST_CRASH_POINT(name) ::kestrel::platform::crashPoint(name)

#else

#define KST_CRASH_POINT(name) ((void)0)

#endif
