#include "daemon/log.h"

#include <atomic>
#include <mutex>

#include "platform/never_destroyed.h"
#include "platform/services.h"

namespace kestrel {

namespace {

struct LogState {
  std::mutex mutex;
  std::shared_ptr<platform::LogHandle> handle;
  std::atomic<int> level{Log::kDefaultLevel};
  std::atomic<bool> hasHandle{false};
};

LogState& state() {
  static platform::NeverDestroyed<LogState> s([](void* where) { return new (where) LogState(); });
  return *s;
}

std::shared_ptr<platform::LogHandle> currentHandle() {
  std::lock_guard lock(state().mutex);
  return state().handle;
}

}  // namespace

struct LogThresholdUpdate {
  static void apply() {
    Log::enabledThreshold_.store(state().hasHandle ? state().level.load() : INT_MAX,
                                 std::memory_order_relaxed);
  }
};

bool Log::open(const std::string& subsystem, const std::string& path, int level) {
  const auto& logging = platform::services().logging;
  std::shared_ptr<platform::LogHandle> handle = logging ? logging->open(subsystem, path) : nullptr;
  std::lock_guard lock(state().mutex);
  state().handle = handle;
  state().hasHandle = handle != nullptr;
  state().level = level;
  LogThresholdUpdate::apply();
  return handle != nullptr;
}

bool Log::enableDiskLogging(const std::string& path, std::size_t fileCount, std::size_t fileSize,
                            int options) {
  auto handle = currentHandle();
  return handle && handle->enableDiskLogging(path, fileCount, fileSize, options);
}

bool Log::hasHandle() {
  return state().hasHandle;
}
int Log::currentLevel() {
  return state().level;
}
void Log::setCurrentLevel(int level) {
  std::lock_guard lock(state().mutex);
  state().level = level;
  LogThresholdUpdate::apply();
}

void Log::write(int level, std::string_view tag, std::string_view message) {
  if (!isEnabled(level)) return;
  // One line never pushes the rest of a rotating log out (a message may
  // describe a whole mapping or dictionary).
  std::string shortened;
  if (message.size() > Log::kMaxLogMessageBytes) {
    shortened.assign(message.substr(0, Log::kMaxLogMessageBytes));
    shortened +=
        " ... (" + std::to_string(message.size() - Log::kMaxLogMessageBytes) + " bytes more)";
    message = shortened;
  }
  if (auto handle = currentHandle()) {
    handle->write(level, tag, message);
    return;
  }
  if (const auto& logging = platform::services().logging) {
    logging->writeWithoutHandle(level, tag, message);
  }
}

void Log::flush() {
  if (auto handle = currentHandle()) handle->flush();
}

void Log::close() {
  std::lock_guard lock(state().mutex);
  state().handle.reset();
  state().hasHandle = false;
  state().level = kDefaultLevel;
  LogThresholdUpdate::apply();
}

}  // namespace kestrel
