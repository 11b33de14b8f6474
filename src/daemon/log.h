// The daemon's process-wide log. Levels: 3 error, 5 notice, 7 debug; the
// current level starts at 5 and a line of level L is written when there is no
// log handle or the current level is at least L. Every line carries a tag: the
// name of the function that wrote it.
//
//   KSTLog(kLogError, "Failed to read metadata at URL %@", url);
//   KSTLogTag(kLogNotice, "main", "kestreld first boot cleanup complete");
#pragma once

#include <atomic>
#include <climits>
#include <memory>
#include <string>
#include <string_view>

#include "platform/format.h"
#include "platform/logging.h"

namespace kestrel {

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

class Log {
 public:
  static constexpr int kDefaultLevel = kLogNotice;
  // Longer messages are cut there, and say how much was left out.
  static constexpr std::size_t kMaxLogMessageBytes = 16 * 1024;

  // Opens the log facility for the subsystem at path, with the level. False
  // (and no handle) when it cannot be opened; lines then go to the platform's
  // default destination.
  static bool open(const std::string& subsystem, const std::string& path, int level);
  // Turns on the rotating disk log of the open handle.
  static bool enableDiskLogging(const std::string& path, std::size_t fileCount,
                                std::size_t fileSize, int options);
  static bool hasHandle();
  static int currentLevel();
  static void setCurrentLevel(int level);
  // Inline and lock-free: debug lines on hot paths (the identifier locks) cost
  // one relaxed load when they are not written.
  static bool isEnabled(int level) {
    return level <= enabledThreshold_.load(std::memory_order_relaxed);
  }
  static void write(int level, std::string_view tag, std::string_view message);
  static void flush();
  // Drops the handle (tests start from a closed log).
  static void close();

 private:
  // The highest level written: the current level with a handle, every level
  // without one. Kept beside the state it is made of, under its mutex.
  static inline constinit std::atomic<int> enabledThreshold_{INT_MAX};
  friend struct LogThresholdUpdate;
};

template <typename... Args>
void logFormatted(int level, std::string_view tag, std::string_view format, Args&&... args) {
  if (!Log::isEnabled(level)) return;
  Log::write(level, tag, formatMessage(format, std::forward<Args>(args)...));
}

}  // namespace kestrel

#define KSTLog(level, format, ...) \
  ::kestrel::logFormatted((level), __func__, (format)__VA_OPT__(, ) __VA_ARGS__)
#define KSTLogTag(level, tag, format, ...) \
  ::kestrel::logFormatted((level), (tag), (format)__VA_OPT__(, ) __VA_ARGS__)
