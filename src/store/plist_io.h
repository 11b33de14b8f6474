// Reading and writing the daemon's own files (container metadata, the replace
// journal, the code-signing mapping, migration markers): each is a property-list
// dictionary, read whole and uncached, written as a binary property list
// (format 1.0) atomically and in data-protection class none. Also the decoding
// of path bytes into strings.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "daemon/errors.h"
#include "platform/plist.h"
#include "store/file_url.h"

namespace kestrel {

// Errors of the property-list library (domain "PropertyListErrorDomain").
inline constexpr const char* kPropertyListErrorDomain = "PropertyListErrorDomain";
enum KSTPropertyListError : std::int64_t {
  // The data is a property list, but not of the kind asked for (not a dictionary).
  kPropertyListFormattingError = 2048,
  // The data is not a property list that can be read: garbage, truncated, an
  // unsupported object, nested too deeply or too large.
  kPropertyListReadCorruptError = 2049,
  // The value cannot be written: a string that is not UTF-8, nesting too deep.
  kPropertyListWriteInvalidError = 2050,
};

// Mutability of what is read. Values are immutable or not by their C++ type, so
// all options read the same; callers still say what they mean.
enum KSTPropertyListReadOptions : std::uint64_t {
  kKSTPropertyListImmutable = 0,
  kKSTPropertyListMutableContainers = 1,
  kKSTPropertyListMutableContainersAndLeaves = 2,
};

// File-write options, a bit set.
enum KSTDataWritingOptions : std::uint64_t {
  // Write to a temporary file beside the target and rename it into place.
  kKSTDataWritingAtomic = 1u << 0,
  // The new file is born in data-protection class none (kKSTProtectionClassNone,
  // store/file_manager.h), readable while the device is locked.
  kKSTDataWritingFileProtectionNone = 1u << 1,
};
// What every writer of the daemon's own files passes.
inline constexpr std::uint64_t kKSTDaemonFileWritingOptions =
    kKSTDataWritingAtomic | kKSTDataWritingFileProtectionNone;

// Reads the property list at url; any format is accepted. nullopt with an error
// when the file cannot be read (POSIX domain, the errno as code), cannot be
// parsed (kPropertyListReadCorruptError) or is not a dictionary
// (kPropertyListFormattingError).
std::optional<PlistDictionary> KST_dictionaryWithContentsOfURL(const KSTFileURL& url,
                                                               std::uint64_t options,
                                                               KSTErrorRef* error);

// Writes dictionary to url as a binary property list, format 1.0, with the
// file-write options (a KSTDataWritingOptions bit set). False with an error
// when it cannot be serialised (kPropertyListWriteInvalidError) or written
// (POSIX domain).
bool KST_writeToURL(const PlistDictionary& dictionary, const KSTFileURL& url,
                    std::uint64_t withOptions, KSTErrorRef* error);

// The string of a path's bytes (the inverse of its file-system
// representation). Linux paths are bytes, kept as they are; a path ends at
// its first NUL byte. A null pointer gives an empty string.
std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length);
std::string stringWithFileSystemRepresentation(const char* bytes);

// Whether any path component of the string is "..".
bool KSTContainsDotDotPathComponents(std::string_view path);

}  // namespace kestrel
