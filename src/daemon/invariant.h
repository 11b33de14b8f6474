// Internal invariants. A broken invariant is a programming error, never a
// condition a client can cause: the process writes the failed condition to the
// log at error level, leaves it as the crash message and aborts.
//
//   KST_INVARIANT(record->useCount > 0);
#pragma once

#include "daemon/log.h"
#include "platform/process.h"

#define KST_INVARIANT(condition)                              \
  do {                                                        \
    if (!(condition)) [[unlikely]] {                          \
      KSTLog(::kestrel::kLogError, "%s", #condition);         \
      ::kestrel::platform::abortWithCrashMessage(#condition); \
    }                                                         \
  } while (false)
