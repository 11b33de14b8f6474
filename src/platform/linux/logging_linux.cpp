// The log facility on Linux: spdlog's rotating file sink for the disk log,
// syslog for the system log, standard error for lines written without a handle
// (the service manager keeps standard error in its journal).
#include "platform/linux/logging_linux.h"

#include <fcntl.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <mutex>

namespace kestrel::platform {

namespace {

const char* levelName(int level) {
  if (level <= kLogError) return "Error";
  if (level <= kLogNotice) return "Notice";
  return "Debug";
}

spdlog::level::level_enum spdlogLevel(int level) {
  if (level <= kLogError) return spdlog::level::err;
  if (level <= kLogNotice) return spdlog::level::info;
  return spdlog::level::debug;
}

// "<Notice> tag: message"; spdlog adds the time, pid and thread id in front.
std::string payload(int level, std::string_view tag, std::string_view message) {
  std::string line;
  line.reserve(tag.size() + message.size() + 16);
  line += '<';
  line += levelName(level);
  line += "> ";
  line += tag;
  line += ": ";
  line += message;
  return line;
}

constexpr const char* kPattern = "%Y-%m-%d %H:%M:%S.%f %P:%t %v";

std::shared_ptr<spdlog::logger> makeStderrLogger(const std::string& name) {
  auto logger =
      std::make_shared<spdlog::logger>(name, std::make_shared<spdlog::sinks::stderr_sink_mt>());
  logger->set_pattern(kPattern);
  logger->set_level(spdlog::level::trace);
  return logger;
}

// Makes the directories above path (0755) and checks that the file can be
// opened for appending.
bool prepareLogFile(const std::string& path) {
  std::error_code ec;
  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  if (!parent.empty() && !std::filesystem::exists(parent, ec)) {
    std::filesystem::create_directories(parent, ec);
    if (ec) return false;
    ::chmod(parent.c_str(), 0755);
  }
  const int fd = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  ::close(fd);
  return true;
}

class LinuxLogHandle final : public LogHandle {
 public:
  explicit LinuxLogHandle(std::string subsystem)
      : subsystem_(std::move(subsystem)), logger_(makeStderrLogger(subsystem_)) {}

  bool enableDiskLogging(const std::string& path, std::size_t fileCount, std::size_t fileSize,
                         int /*options*/) override {
    try {
      // spdlog counts the files kept beside the current one.
      auto sink = std::make_shared<spdlog::sinks::rotating_file_sink_mt>(
          path, fileSize, fileCount > 0 ? fileCount - 1 : 0);
      auto logger = std::make_shared<spdlog::logger>(subsystem_, std::move(sink));
      logger->set_pattern(kPattern);
      logger->set_level(spdlog::level::trace);
      logger->flush_on(spdlog::level::trace);
      std::lock_guard lock(mutex_);
      logger_ = std::move(logger);
      return true;
    } catch (const std::exception&) {
      return false;
    }
  }

  void write(int level, std::string_view tag, std::string_view message) override {
    std::shared_ptr<spdlog::logger> logger;
    {
      std::lock_guard lock(mutex_);
      logger = logger_;
    }
    try {
      logger->log(spdlogLevel(level), "{}", payload(level, tag, message));
    } catch (const std::exception&) {
      // A log line that cannot be written is dropped; logging never fails an operation.
    }
  }

  void flush() override {
    std::lock_guard lock(mutex_);
    try {
      logger_->flush();
    } catch (const std::exception&) {
    }
  }

 private:
  std::string subsystem_;
  std::mutex mutex_;
  std::shared_ptr<spdlog::logger> logger_;
};

class LinuxLogging final : public Logging {
 public:
  LinuxLogging() : fallback_(makeStderrLogger("kestreld")) {}

  std::unique_ptr<LogHandle> open(const std::string& subsystem, const std::string& path) override {
    if (!prepareLogFile(path)) return nullptr;
    return std::make_unique<LinuxLogHandle>(subsystem);
  }

  void writeWithoutHandle(int level, std::string_view tag, std::string_view message) override {
    try {
      fallback_->log(spdlogLevel(level), "{}", payload(level, tag, message));
    } catch (const std::exception&) {
    }
  }

  void writeSystemLog(int priority, std::string_view message) override {
    std::call_once(syslogOpened_, [] { ::openlog("kestreld", LOG_PID, LOG_DAEMON); });
    const std::string text(message);
    ::syslog(priority, "%s", text.c_str());
  }

 private:
  std::shared_ptr<spdlog::logger> fallback_;
  std::once_flag syslogOpened_;
};

}  // namespace

std::shared_ptr<Logging> makeLinuxLogging(const FilesystemRoot& /*root*/) {
  return std::make_shared<LinuxLogging>();
}

}  // namespace kestrel::platform
