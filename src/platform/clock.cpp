#include "platform/clock.h"

#include <ctime>

namespace kestrel::platform {

std::string currentDateDescription() {
  const std::time_t now = std::time(nullptr);
  std::tm utc{};
  char text[64] = {};
  if (::gmtime_r(&now, &utc) == nullptr ||
      std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &utc) == 0) {
    return "Unknown";
  }
  return text;
}

}  // namespace kestrel::platform
