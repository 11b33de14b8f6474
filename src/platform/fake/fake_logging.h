// An in-memory log facility for tests: every line, the disk-logging settings
// and the system-log messages are kept for inspection.
#pragma once

#include <cstddef>
#include <mutex>
#include <string>
#include <vector>

#include "platform/logging.h"

namespace kestrel::platform {

struct FakeLogLine {
  int level = 0;
  std::string tag;
  std::string message;
  bool withHandle = false;
};

struct FakeDiskLogging {
  std::string path;
  std::size_t fileCount = 0;
  std::size_t fileSize = 0;
  int options = 0;
};

class FakeLogging final : public Logging {
 public:
  std::unique_ptr<LogHandle> open(const std::string& subsystem, const std::string& path) override;
  void writeWithoutHandle(int level, std::string_view tag, std::string_view message) override;
  void writeSystemLog(int priority, std::string_view message) override;

  void setOpenFails(bool fails);
  std::vector<FakeLogLine> lines() const;
  std::vector<std::string> systemLog() const;
  std::vector<FakeDiskLogging> diskLogging() const;
  std::string openedPath() const;
  // True when some line has the tag and exactly the message.
  bool contains(std::string_view tag, std::string_view message) const;
  // True when some line's message is exactly the message, whatever its tag.
  bool containsMessage(std::string_view message) const;
  void clear();

 private:
  friend class FakeLogHandle;
  void record(FakeLogLine line);
  void recordDiskLogging(FakeDiskLogging settings);

  mutable std::mutex mutex_;
  bool openFails_ = false;
  std::string openedPath_;
  std::vector<FakeLogLine> lines_;
  std::vector<std::string> systemLog_;
  std::vector<FakeDiskLogging> diskLogging_;
};

}  // namespace kestrel::platform
