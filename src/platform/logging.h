// The log facility: a rotating disk log for the daemon's own lines, the system
// log for the one message that says the disk log could not be set up, and a
// default destination for lines written while there is no log handle.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>

namespace kestrel::platform {

enum LogLevel : int { kLogError = 3, kLogNotice = 5, kLogDebug = 7 };

class LogHandle {
 public:
  virtual ~LogHandle() = default;
  // Keeps fileCount files of at most fileSize bytes each at path (the current
  // file at path, older ones beside it). False when the files cannot be opened.
  virtual bool enableDiskLogging(const std::string& path, std::size_t fileCount,
                                 std::size_t fileSize, int options) = 0;
  virtual void write(int level, std::string_view tag, std::string_view message) = 0;
  virtual void flush() = 0;
};

class Logging {
 public:
  virtual ~Logging() = default;
  // A handle for the subsystem logging to path; nullptr when the log at path
  // cannot be opened (its directory cannot be made or the file not written).
  virtual std::unique_ptr<LogHandle> open(const std::string& subsystem, const std::string& path) = 0;
  // Lines written while there is no handle.
  virtual void writeWithoutHandle(int level, std::string_view tag, std::string_view message) = 0;
  // The system log (syslog priority, e.g. LOG_ERR).
  virtual void writeSystemLog(int priority, std::string_view message) = 0;
};

}  // namespace kestrel::platform
