// Property-list serialisation: bytes of a binary ("bplist00") or XML property
// list become a PlistValue, and a PlistValue becomes a binary property list,
// format version 1.0.
//
// Input is treated as hostile: it may come from a file that someone else could
// replace. Binary input is read by our own reader (binary_plist_reader.h); XML
// is checked for size, nesting depth and element count before libplist sees it.
// Anything unexpected is an error, never a crash.
//
// What the binary format can hold decides what comes back from a round trip:
//   - an unsigned integer that fits in a signed one reads back as a signed
//     integer (the format has one integer type; only values above INT64_MAX are
//     stored as unsigned), so compare integers through signedInteger() or
//     unsignedInteger();
//   - strings must be UTF-8 without NUL bytes (dictionary keys too);
//   - dates keep their exact seconds.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/plist.h"

namespace kestrel::platform {

// Largest property list read or written, in bytes. The daemon's own files are a
// few kilobytes; the code-signing mapping of a full device stays far below this.
inline constexpr std::size_t kMaxPropertyListSize = std::size_t{16} * 1024 * 1024;
// Deepest nesting of arrays and dictionaries accepted (the top level is depth 1).
inline constexpr int kMaxPropertyListDepth = 512;
// Most objects (values, keys included) a binary property list may hold.
inline constexpr std::size_t kMaxPropertyListObjects = 1'000'000;

// Parses a property list. nullopt on failure, with a reason in *error (may be null).
std::optional<PlistValue> parsePropertyList(std::span<const std::uint8_t> bytes,
                                            std::string* error);

// Serialises a value as a binary property list, format version 1.0 ("bplist00").
// nullopt on failure (a string that is not UTF-8 or holds a NUL byte, nesting
// deeper than kMaxPropertyListDepth, a result larger than kMaxPropertyListSize),
// with a reason in *error (may be null).
std::optional<std::vector<std::uint8_t>> serializeBinaryPropertyList(const PlistValue& value,
                                                                     std::string* error);

}  // namespace kestrel::platform
