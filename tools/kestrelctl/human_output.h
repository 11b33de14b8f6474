// Replies of the named subcommands as text for people: one line per fact,
// tables for lists, and a short name for well-known error codes.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "commands.h"
#include "platform/message_ipc.h"

namespace kestrel::kestrelctl {

// The successful reply of the subcommand, every line ending in a newline. A
// key the reply lacks shows as "-".
std::string renderReply(Subcommand subcommand, const platform::MessageDictionary& reply);

// A byte count for people, in binary units with one decimal: "0 B", "1023 B",
// "1.5 KiB", "12.0 MiB", ... up to EiB.
std::string humanBytes(std::uint64_t bytes);

// "not found" for 21, and so on; empty for a code without a name.
std::string_view errorCodeName(std::uint64_t code);

// "kestrelctl: <subcommand> failed: error <code> (<name>)", without the name
// when the code has none; no newline.
std::string failureMessage(std::string_view subcommand, std::uint64_t code);

}  // namespace kestrel::kestrelctl
