// Request items given on the command line: "key=type:value".
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/message_ipc.h"
#include "platform/plist.h"

namespace kestrel::kestrelctl {

// Adds one item to the request. Types: u64, i64, bool, str, uuid, data (hex),
// plist (a JSON value). False with a message naming what is wrong.
bool addRequestItem(std::string_view item, platform::MessageDictionary* request,
                    std::string* error);

// A JSON text as a property list: objects, arrays, strings, booleans, integers
// (signed unless too large for int64) and reals. Nothing, with a message, for
// malformed JSON, a null (which has no property-list form) or containers
// nested more than 256 levels deep.
std::optional<PlistValue> plistFromJson(std::string_view json, std::string* error);

}  // namespace kestrel::kestrelctl
