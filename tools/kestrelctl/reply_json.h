// A reply dictionary as JSON, for people and scripts.
#pragma once

#include <nlohmann/json.hpp>

#include "platform/message_ipc.h"

namespace kestrel::kestrelctl {

// uint64, int64, booleans, strings and doubles as themselves; arrays and
// dictionaries as arrays and objects; data as a hex string, except 16 bytes
// under a key whose name contains "UUID" (or inside an array under such a
// key), which print as an upper-case UUID: on the wire the two look alike.
nlohmann::json replyToJson(const platform::MessageDictionary& reply);

}  // namespace kestrel::kestrelctl
