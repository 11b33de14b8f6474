#include "store/plist_io.h"

#include <cstring>
#include <system_error>
#include <vector>

#include "platform/file_system.h"
#include "platform/plist_serialization.h"
#include "store/file_manager.h"

namespace kestrel {

namespace {

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

KSTErrorRef propertyListError(const char* function, int line, std::int64_t code, const char* format,
                              const KSTFileURL& url, const std::string& reason) {
  return KSTCreateError(function, line, kPropertyListErrorDomain, code, nullptr, nullptr, false,
                        format, url, reason);
}

}  // namespace

std::optional<PlistDictionary> KST_dictionaryWithContentsOfURL(const KSTFileURL& url,
                                                               std::uint64_t options,
                                                               KSTErrorRef* error) {
  (void)options;  // Mutability means nothing to a value type.
  std::vector<std::uint8_t> contents;
  if (const int read = platform::readWholeFile(url.fileSystemRepresentation(),
                                               platform::kMaxPropertyListSize, &contents);
      read != 0) {
    KSTSetError(error, KST_POSIX_ERROR(read, "Failed to read %@: %s", url, errnoText(read)));
    return std::nullopt;
  }
  std::string reason;
  std::optional<PlistValue> value = platform::parsePropertyList(contents, &reason);
  if (!value) {
    KSTSetError(error,
                propertyListError(__func__, __LINE__, kPropertyListReadCorruptError,
                                  "Failed to parse the property list at %@: %s", url, reason));
    return std::nullopt;
  }
  PlistDictionary* dictionary = value->dictionary();
  if (dictionary == nullptr) {
    KSTSetError(error, KSTCreateError(__func__, __LINE__, kPropertyListErrorDomain,
                                      kPropertyListFormattingError, nullptr, nullptr, false,
                                      "The property list at %@ is not a dictionary", url));
    return std::nullopt;
  }
  return std::move(*dictionary);
}

bool KST_writeToURL(const PlistDictionary& dictionary, const KSTFileURL& url,
                    std::uint64_t withOptions, KSTErrorRef* error) {
  std::string reason;
  const std::optional<std::vector<std::uint8_t>> data =
      platform::serializeBinaryPropertyList(PlistValue(dictionary), &reason);
  if (!data) {
    KSTSetError(error,
                propertyListError(__func__, __LINE__, kPropertyListWriteInvalidError,
                                  "Failed to serialise the property list for %@: %s", url, reason));
    return false;
  }
  platform::FileWriteOptions options;
  options.atomic = (withOptions & kKSTDataWritingAtomic) != 0;
  if ((withOptions & kKSTDataWritingFileProtectionNone) != 0) {
    options.protectionClass = static_cast<std::int32_t>(kKSTProtectionClassNone);
  }
  if (const int written = platform::writeFile(url.fileSystemRepresentation(), *data, options);
      written != 0) {
    KSTSetError(error, KST_POSIX_ERROR(written, "Failed to write %@: %s", url, errnoText(written)));
    return false;
  }
  return true;
}

std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length) {
  if (bytes == nullptr) return std::string();
  const void* nul = std::memchr(bytes, '\0', length);
  if (nul != nullptr) length = static_cast<std::size_t>(static_cast<const char*>(nul) - bytes);
  return std::string(bytes, length);
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
  return bytes == nullptr ? std::string()
                          : stringWithFileSystemRepresentation(bytes, std::strlen(bytes));
}

}  // namespace kestrel
