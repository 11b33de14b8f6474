#include "platform/fake/fake_logging.h"

namespace kestrel::platform {

class FakeLogHandle final : public LogHandle {
 public:
  explicit FakeLogHandle(FakeLogging& owner) : owner_(owner) {}
  bool enableDiskLogging(const std::string& path, std::size_t fileCount, std::size_t fileSize,
                         int options) override {
    owner_.recordDiskLogging({path, fileCount, fileSize, options});
    return true;
  }
  void write(int level, std::string_view tag, std::string_view message) override {
    owner_.record({level, std::string(tag), std::string(message), true});
  }
  void flush() override {}

 private:
  FakeLogging& owner_;
};

std::unique_ptr<LogHandle> FakeLogging::open(const std::string& /*subsystem*/,
                                             const std::string& path) {
  std::lock_guard lock(mutex_);
  if (openFails_) return nullptr;
  openedPath_ = path;
  return std::make_unique<FakeLogHandle>(*this);
}

void FakeLogging::writeWithoutHandle(int level, std::string_view tag, std::string_view message) {
  record({level, std::string(tag), std::string(message), false});
}

void FakeLogging::writeSystemLog(int /*priority*/, std::string_view message) {
  std::lock_guard lock(mutex_);
  systemLog_.emplace_back(message);
}

void FakeLogging::setOpenFails(bool fails) {
  std::lock_guard lock(mutex_);
  openFails_ = fails;
}

std::vector<FakeLogLine> FakeLogging::lines() const {
  std::lock_guard lock(mutex_);
  return lines_;
}

std::vector<std::string> FakeLogging::systemLog() const {
  std::lock_guard lock(mutex_);
  return systemLog_;
}

std::vector<FakeDiskLogging> FakeLogging::diskLogging() const {
  std::lock_guard lock(mutex_);
  return diskLogging_;
}

std::string FakeLogging::openedPath() const {
  std::lock_guard lock(mutex_);
  return openedPath_;
}

bool FakeLogging::contains(std::string_view tag, std::string_view message) const {
  std::lock_guard lock(mutex_);
  for (const auto& line : lines_) {
    if (line.tag == tag && line.message == message) return true;
  }
  return false;
}

bool FakeLogging::containsMessage(std::string_view message) const {
  std::lock_guard lock(mutex_);
  for (const auto& line : lines_) {
    if (line.message == message) return true;
  }
  return false;
}

void FakeLogging::clear() {
  std::lock_guard lock(mutex_);
  lines_.clear();
  systemLog_.clear();
  diskLogging_.clear();
}

void FakeLogging::record(FakeLogLine line) {
  std::lock_guard lock(mutex_);
  lines_.push_back(std::move(line));
}

void FakeLogging::recordDiskLogging(FakeDiskLogging settings) {
  std::lock_guard lock(mutex_);
  diskLogging_.push_back(std::move(settings));
}

}  // namespace kestrel::platform
