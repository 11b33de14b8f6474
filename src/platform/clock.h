// The wall clock, as text.
#pragma once

#include <string>

namespace kestrel::platform {

// The current date and time in UTC, as "2026-11-24 02:54:10 +0000".
std::string currentDateDescription();

}  // namespace kestrel::platform
