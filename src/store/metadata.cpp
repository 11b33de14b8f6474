#include "store/metadata.h"

#include "store/plist_io.h"

namespace kestrel {

namespace {

// "%@" of a value that may be absent: "(null)" then.
FormatArg valueArg(const PlistValue* value) {
  return value != nullptr ? FormatArg(*value) : FormatArg(nullptr);
}

const PlistValue* member(const PlistDictionary& dictionary, std::string_view key) {
  auto it = dictionary.find(key);
  return it == dictionary.end() ? nullptr : &it->second;
}

// The class as the "%ld" of the message shows it.
std::int64_t classForMessage(const PlistValue& value) {
  if (auto u = value.unsignedInteger()) return static_cast<std::int64_t>(*u);
  return value.signedInteger().value_or(0);
}

// A stored persona names the user only when it is that integer: no rounding
// of a real, no truncation of a wider number.
bool personaIsUser(const PlistValue& persona, std::uint32_t userId) {
  if (persona.type() != PlistValue::Type::Integer &&
      persona.type() != PlistValue::Type::UnsignedInteger) {
    return false;
  }
  const std::optional<std::uint64_t> value = persona.unsignedInteger();
  return value && *value == userId;
}

// Whether the container at `path` sits in the class directory its file names:
// .../Containers/Data/Application/NAME against .../Containers + the class path.
bool sitsInItsClassDirectory(std::string_view path, KSTContainerClass containerClass) {
  // Asked for every container of a cache rebuild: no path is built.
  const std::string_view found = KSTFileURL::parentPath(path);
  const std::string_view base = KSTFileURL::parentPath(KSTFileURL::parentPath(found));
  std::string_view classPath = KSTContainerClassPath(containerClass);
  while (!classPath.empty() && classPath.front() == '/') classPath.remove_prefix(1);
  while (!classPath.empty() && classPath.back() == '/') classPath.remove_suffix(1);
  if (classPath.empty()) return found == base;
  const std::string_view prefix = base == "/" ? std::string_view() : base;
  return found.size() == prefix.size() + 1 + classPath.size() && found.starts_with(prefix) &&
         found[prefix.size()] == '/' && found.ends_with(classPath);
}

}  // namespace

KSTMetadata::KSTMetadata(std::uint32_t userId, platform::Uuid uuid,
                         KSTContainerClass containerClass, std::string identifier,
                         std::optional<PlistDictionary> info, KSTFileURL url)
    : containerClass_(containerClass),
      identifier_(std::move(identifier)),
      uid_(userId),
      uuid_(uuid),
      info_(std::move(info)),
      url_(std::move(url)) {}

std::shared_ptr<KSTMetadata> KSTMetadata::initWithUserId(std::uint32_t userId, platform::Uuid uuid,
                                                         KSTContainerClass containerClass,
                                                         std::string identifier,
                                                         std::optional<PlistDictionary> info,
                                                         KSTFileURL url) {
  return std::make_shared<KSTMetadata>(userId, uuid, containerClass, std::move(identifier),
                                       std::move(info), std::move(url));
}

std::shared_ptr<KSTMetadata> KSTMetadata::readAndValidateMetadataAtUrl(const KSTFileURL& url,
                                                                       std::uint32_t forUser,
                                                                       bool checkClassPath,
                                                                       KSTErrorRef* error) {
  KSTErrorRef readError;
  std::optional<PlistDictionary> dictionary = KST_dictionaryWithContentsOfURL(
      metadataFileURL(url), kKSTPropertyListMutableContainersAndLeaves, &readError);
  if (!dictionary) {
    KSTSetError(error, KST_ERROR(kKSTErrorMetadataReadFailed, readError, true,
                                 "Failed to read metadata at URL %@", url));
    return nullptr;
  }

  const PlistValue* identifier = member(*dictionary, kKSTMetadataIdentifierKey);
  if (identifier == nullptr || !identifier->isString()) {
    KSTSetError(error,
                KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                          "Invalid metadata Identifier: %@ at %@", valueArg(identifier), url));
    return nullptr;
  }

  const PlistValue* uuidString = member(*dictionary, kKSTMetadataUUIDKey);
  if (uuidString == nullptr || !uuidString->isString()) {
    KSTSetError(error,
                KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                          "Invalid metadata UUID String: %@ at %@", valueArg(uuidString), url));
    return nullptr;
  }
  const std::optional<platform::Uuid> uuid = platform::Uuid::parse(*uuidString->string());
  if (!uuid) {
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Invalid metadata UUID: %@ at %@", *uuidString->string(), url));
    return nullptr;
  }

  const PlistValue* classValue = member(*dictionary, kKSTMetadataContentClassKey);
  if (classValue == nullptr || !classValue->isNumber()) {
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Invalid metadata Class: %@ at %@", valueArg(classValue), url));
    return nullptr;
  }
  const std::optional<std::uint64_t> containerClass = classValue->unsignedInteger();
  if (!containerClass || !KSTIsValidContainerClass(*containerClass)) {
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Invalid metadata Content Class: %ld at %@",
                                 classForMessage(*classValue), url));
    return nullptr;
  }

  // Files of older releases have no persona: those of the default mobile user
  // and of the installer are recognised by their class. Only the record read
  // here changes; the file stays as it is.
  if (member(*dictionary, kKSTMetadataPersonaKey) == nullptr) {
    if (forUser == kKSTFirstMobileUserId && KSTIsPerUserClass(*containerClass)) {
      (*dictionary)[kKSTMetadataPersonaKey] = PlistValue(kKSTFirstMobileUserId);
    } else if (forUser == kKSTInstallerUserId && KSTIsBundleClass(*containerClass)) {
      (*dictionary)[kKSTMetadataPersonaKey] = PlistValue(kKSTInstallerUserId);
    }
  }
  if (const PlistValue* persona = member(*dictionary, kKSTMetadataPersonaKey);
      persona != nullptr && !personaIsUser(*persona, forUser)) {
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Incorrect UserId: %@, expecting: %u for %@ at %@", *persona,
                                 forUser, *identifier->string(), url));
    return nullptr;
  }

  const PlistValue* info = member(*dictionary, kKSTMetadataInfoKey);
  if (info != nullptr && !info->isDictionary()) {
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Invalid metadata Info: %@ at %@", *info, url));
    return nullptr;
  }

  if (checkClassPath && !sitsInItsClassDirectory(url.path(), *containerClass)) {
    KSTFileURL expected = url;
    for (int i = 0; i < 3; ++i) expected = expected.deletingLastPathComponent();
    expected = expected.appending(KSTContainerClassPath(*containerClass), true);
    KSTSetError(error, KST_ERROR(kKSTErrorInvalidMetadata, nullptr, true,
                                 "Invalid metadata-URLs should match: %@ : %@", url, expected));
    return nullptr;
  }

  std::optional<PlistDictionary> infoDictionary;
  if (info != nullptr) infoDictionary = *info->dictionary();
  return initWithUserId(forUser, *uuid, *containerClass, *identifier->string(),
                        std::move(infoDictionary), url);
}

bool KSTMetadata::writeMetadataToDiskWithError(KSTErrorRef* error) const {
  PlistDictionary dictionary;
  KSTFileURL containerURL;
  {
    std::lock_guard guard(mutex_);
    if (info_) dictionary[kKSTMetadataInfoKey] = *info_;
    dictionary[kKSTMetadataContentClassKey] = PlistValue(containerClass_);
    dictionary[kKSTMetadataPersonaKey] = PlistValue(static_cast<std::uint64_t>(uid_));
    dictionary[kKSTMetadataIdentifierKey] = identifier_;
    dictionary[kKSTMetadataUUIDKey] = uuid_.string();
    containerURL = url_;
  }
  KSTErrorRef writeError;
  if (!KST_writeToURL(dictionary, metadataFileURL(containerURL), kKSTDaemonFileWritingOptions,
                      &writeError)) {
    KSTSetError(error, KST_ERROR(kKSTErrorWriteFailed, writeError, true,
                                 "Failed to write metadata dictionary to URL %@", containerURL));
    return false;
  }
  return true;
}

std::uint32_t KSTMetadata::uid() const {
  std::lock_guard guard(mutex_);
  return uid_;
}

void KSTMetadata::setUid(std::uint32_t uid) {
  std::lock_guard guard(mutex_);
  uid_ = uid;
}

platform::Uuid KSTMetadata::uuid() const {
  std::lock_guard guard(mutex_);
  return uuid_;
}

void KSTMetadata::setUuid(const platform::Uuid& uuid) {
  std::lock_guard guard(mutex_);
  uuid_ = uuid;
}

std::optional<PlistDictionary> KSTMetadata::info() const {
  std::lock_guard guard(mutex_);
  return info_;
}

void KSTMetadata::setInfo(std::optional<PlistDictionary> info) {
  std::lock_guard guard(mutex_);
  info_ = std::move(info);
}

KSTFileURL KSTMetadata::url() const {
  std::lock_guard guard(mutex_);
  return url_;
}

void KSTMetadata::setUrl(KSTFileURL url) {
  std::lock_guard guard(mutex_);
  url_ = std::move(url);
}

std::string KSTMetadata::description() const {
  std::lock_guard guard(mutex_);
  return formatMessage("<KSTMetadata: %@ class %llu uid %u uuid %@ at %@>", identifier_,
                       containerClass_, uid_, uuid_, url_);
}

}  // namespace kestrel
