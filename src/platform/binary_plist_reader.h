// The reader of binary property lists ("bplist00"). The bytes are treated as
// hostile: the trailer, the offset table and the whole object graph are checked
// (every reference names an object, no cycle, nesting within
// kMaxPropertyListDepth, at most kMaxPropertyListObjects values once shared
// subtrees are copied out) before a single value is built, and every payload is
// bounds-checked as it is read.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/plist.h"

namespace kestrel::platform {

// The value of a binary property list; nullopt with a reason in *error (may be
// null) when the bytes are not one this daemon accepts. Sets read as arrays;
// UID objects, null and fill objects are refused.
std::optional<PlistValue> readBinaryPropertyList(std::span<const std::uint8_t> bytes,
                                                 std::string* error);

}  // namespace kestrel::platform
