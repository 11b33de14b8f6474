#include "daemon/command_requests.h"

#include <limits>
#include <utility>

#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "daemon/request_dispatch.h"

namespace kestrel {

namespace {

using platform::MessageArray;
using platform::MessageDictionary;
using platform::MessageValue;
using platform::Uuid;

constexpr const char* kUserIdKey = "UserID";
constexpr const char* kContainerClassKey = "ContainerClass";
constexpr const char* kIdentifierKey = "Identifier";
constexpr const char* kUUIDKey = "UUID";
constexpr const char* kTransientKey = "Transient";

const char* typeName(MessageValue::Type type) {
  switch (type) {
    case MessageValue::Type::Uint64:
      return "uint64";
    case MessageValue::Type::Int64:
      return "int64";
    case MessageValue::Type::Boolean:
      return "boolean";
    case MessageValue::Type::String:
      return "string";
    case MessageValue::Type::Data:
      return "data";
    case MessageValue::Type::Array:
      return "array";
    case MessageValue::Type::Dictionary:
      return "dictionary";
    case MessageValue::Type::Double:
      return "double";
  }
  return "value";
}

// Reads the keys of one request for one decoder. A key of another type than
// the one asked for reads as absent, as the message's own typed reads do; a
// debug line says so. A failure (a user the client may not name, a value
// nested too deep) ends the decoding: the code is set, and every later read
// gives the absent value without looking.
class RequestReader {
 public:
  RequestReader(const MessageDictionary& request, const char* tag, std::uint64_t* error)
      : request_(request), tag_(tag), error_(error) {}

  bool ok() const { return ok_; }

  // Ends the decoding with the code; the caller has logged why.
  void fail(std::uint64_t code) {
    if (!ok_) return;
    ok_ = false;
    KSTSetCode(error_, code);
  }

  std::uint64_t uint64(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return 0;
    if (auto v = value->uint64()) return *v;
    wrongType(key, *value, "uint64");
    return 0;
  }

  std::int64_t int64(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return 0;
    if (auto v = value->int64()) return *v;
    wrongType(key, *value, "int64");
    return 0;
  }

  bool boolean(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return false;
    if (auto v = value->boolean()) return *v;
    wrongType(key, *value, "boolean");
    return false;
  }

  std::optional<std::string> string(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return std::nullopt;
    if (const std::string* v = value->string()) return *v;
    wrongType(key, *value, "string");
    return std::nullopt;
  }

  std::optional<Uuid> uuid(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return std::nullopt;
    if (auto v = value->uuid()) return v;
    wrongType(key, *value, "UUID");
    return std::nullopt;
  }

  // Any type, as long as it converts.
  std::optional<PlistValue> plist(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return std::nullopt;
    if (auto v = platform::messageValueToPlist(*value)) return v;
    KSTLogTag(kLogError, tag_, "Request key \"%@\" is nested too deep to read", key);
    fail(kKSTErrorInvalidParameter);
    return std::nullopt;
  }

  // nullptr when absent (or after a failure).
  const MessageArray* array(const char* key) {
    const MessageValue* value = present(key);
    if (value == nullptr) return nullptr;
    if (const MessageArray* v = value->array()) return v;
    wrongType(key, *value, "array");
    return nullptr;
  }

  // The "Identifier" string, else the client's own signing identifier.
  std::optional<std::string> ownIdentifier(const KSTClientConnection& client) {
    if (std::optional<std::string> identifier = string(kIdentifierKey)) return identifier;
    return client.clientBundleIdentifier();
  }

  // The low 32 bits of the requested user, resolved for the class; a refusal
  // (logged by validateUserId) ends the decoding with 38.
  std::uint32_t resolveUser(std::uint64_t requested, KSTContainerClass containerClass,
                            const KSTClientConnection& client) {
    if (!ok_) return 0;
    std::uint32_t resolved = 0;
    if (!validateUserId(static_cast<std::uint32_t>(requested), containerClass,
                        client.clientUserId(), &resolved, error_)) {
      fail(kKSTErrorInvalidParameter);
      return 0;
    }
    return resolved;
  }

  template <typename T>
  std::optional<T> result(T decoded) const {
    if (!ok_) return std::nullopt;
    return decoded;
  }

  const char* tag() const { return tag_; }

 private:
  const MessageValue* present(const char* key) const { return ok_ ? request_.value(key) : nullptr; }

  void wrongType(const char* key, const MessageValue& found, const char* expected) const {
    KSTLogTag(kLogDebug, tag_, "Request key \"%@\" has type %@, expected %@; read as absent", key,
              typeName(found.type()), expected);
  }

  const MessageDictionary& request_;
  const char* tag_;
  std::uint64_t* error_;
  bool ok_ = true;
};

// The keys of the commands that name one container by class, user, UUID and identifier.
struct ContainerKeys {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<Uuid> uuid;
  std::optional<std::string> identifier;
};

ContainerKeys readContainerKeys(RequestReader& in, const KSTClientConnection& client) {
  ContainerKeys keys;
  keys.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  keys.uuid = in.uuid(kUUIDKey);
  keys.identifier = in.string(kIdentifierKey);
  keys.userId = in.resolveUser(user, keys.containerClass, client);
  return keys;
}

std::optional<KSTWipeContainerRequest> decodeWipe(RequestReader& in,
                                                  std::optional<KSTContainerClass> fixedClass,
                                                  const KSTClientConnection& client) {
  KSTWipeContainerRequest decoded;
  decoded.containerClass = fixedClass ? *fixedClass : in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.identifier = in.string(kIdentifierKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

}  // namespace

std::optional<KSTCreateOrLookupRequest> KSTDecodeCreateOrLookupRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTCreateOrLookupRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.identifier = in.ownIdentifier(client);
  decoded.createIfNecessary = in.boolean("CreateIfNecessary");
  decoded.transient = in.boolean(kTransientKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTListContainersRequest> KSTDecodeListContainersRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTListContainersRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.transient = in.boolean(kTransientKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(decoded);
}

std::optional<KSTReplaceContainerRequest> KSTDecodeReplaceContainerRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTReplaceContainerRequest decoded;
  decoded.oldContainerUUID = in.uuid("OldContainerUUID");
  std::uint64_t oldUser = 0;
  if (decoded.oldContainerUUID) {
    decoded.oldContainerClass = in.uint64("OldContainerClass");
    decoded.oldIdentifier = in.string("OldIdentifier");
    oldUser = in.uint64("OldContainerUserID");
  }
  decoded.newContainerClass = in.uint64("NewContainerClass");
  const std::uint64_t newUser = in.uint64("NewContainerUserID");
  decoded.newContainerUUID = in.uuid("NewContainerUUID");
  decoded.newIdentifier = in.string("NewIdentifier");
  if (decoded.oldContainerUUID) {
    decoded.oldUserId = in.resolveUser(oldUser, decoded.oldContainerClass, client);
  }
  decoded.newUserId = in.resolveUser(newUser, decoded.newContainerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTStageForDeleteRequest> KSTDecodeStageForDeleteRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  const MessageArray* classes = in.array("ContainerClassesArray");
  const MessageArray* uuids = in.array("UUIDsArray");
  const MessageArray* users = in.array("UserIDsArray");
  std::optional<PlistValue> identifiers = in.plist("IdentifiersArray");
  if (!in.ok()) return std::nullopt;

  KSTStageForDeleteRequest decoded;
  if (classes != nullptr) {
    for (const MessageValue& entry : *classes) decoded.containerClasses.push_back(entry.uint64());
  }
  if (uuids != nullptr) {
    for (const MessageValue& entry : *uuids) decoded.uuids.push_back(entry.uuid());
  }
  if (identifiers) {
    if (const PlistArray* entries = identifiers->array()) {
      decoded.identifiers.emplace();
      for (const PlistValue& entry : *entries) {
        const std::string* text = entry.string();
        decoded.identifiers->push_back(text != nullptr ? std::optional(*text) : std::nullopt);
      }
    } else {
      KSTLogTag(kLogError, "stageContainerForDelete",
                "Got non-Array input for the identifiers array");
    }
  }

  const std::size_t userCount = users != nullptr ? users->size() : 0;
  if (decoded.containerClasses.size() < userCount) {
    KSTLogTag(kLogError, in.tag(), "Can't act on an invalid input: %ld user ids, %ld classes",
              userCount, decoded.containerClasses.size());
    in.fail(kKSTErrorInvalidObject);
    return std::nullopt;
  }
  decoded.userIds.reserve(userCount);
  for (std::size_t i = 0; i < userCount; ++i) {
    // A user entry that is not a number reads as 0, which no check accepts.
    const std::uint64_t user = (*users)[i].uint64().value_or(0);
    const KSTContainerClass containerClass = decoded.containerClasses[i].value_or(0);
    decoded.userIds.push_back(in.resolveUser(user, containerClass, client));
    if (!in.ok()) return std::nullopt;
  }
  return decoded;
}

std::optional<KSTSetInfoValueRequest> KSTDecodeSetInfoValueRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTSetInfoValueRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.value = in.plist("Value");
  decoded.key = in.string("Key");
  decoded.uuid = in.uuid(kUUIDKey);
  decoded.identifier = in.string(kIdentifierKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTInfoValueRequest> KSTDecodeInfoValueRequest(const MessageDictionary& request,
                                                             const KSTClientConnection& client,
                                                             std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTInfoValueRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.key = in.string("Key");
  decoded.uuid = in.uuid(kUUIDKey);
  decoded.identifier = in.string(kIdentifierKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTMetadataRequest> KSTDecodeMetadataRequest(const MessageDictionary& request,
                                                           const KSTClientConnection& client,
                                                           std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  ContainerKeys keys = readContainerKeys(in, client);
  KSTMetadataRequest decoded;
  decoded.infoDictRequested = in.boolean("InfoDictRequested");
  decoded.containerClass = keys.containerClass;
  decoded.userId = keys.userId;
  decoded.uuid = keys.uuid;
  decoded.identifier = std::move(keys.identifier);
  return in.result(std::move(decoded));
}

std::optional<KSTContainerRequest> KSTDecodeContainerRequest(const MessageDictionary& request,
                                                             const KSTClientConnection& client,
                                                             std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  ContainerKeys keys = readContainerKeys(in, client);
  KSTContainerRequest decoded;
  decoded.containerClass = keys.containerClass;
  decoded.userId = keys.userId;
  decoded.uuid = keys.uuid;
  decoded.identifier = std::move(keys.identifier);
  return in.result(std::move(decoded));
}

std::optional<KSTDeleteContainerRequest> KSTDecodeDeleteContainerRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTDeleteContainerRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.identifier = in.string(kIdentifierKey);
  decoded.transient = in.boolean(kTransientKey);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTWipeContainerRequest> KSTDecodeWipePluginContainerRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  return decodeWipe(in, kKSTContainerClassDataVantlerPlugin, client);
}

std::optional<KSTWipeContainerRequest> KSTDecodeWipeContainerRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  return decodeWipe(in, std::nullopt, client);
}

std::optional<KSTAppGroupRequest> KSTDecodeAppGroupRequest(const MessageDictionary& request,
                                                           const KSTClientConnection& client,
                                                           std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTAppGroupRequest decoded;
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.identifier = in.ownIdentifier(client);
  decoded.userId = in.resolveUser(user, kKSTContainerClassSharedAppGroup, client);
  return in.result(std::move(decoded));
}

std::optional<KSTOwnIdentifierRequest> KSTDecodeOwnIdentifierRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTOwnIdentifierRequest decoded;
  decoded.identifier = in.ownIdentifier(client);
  return in.result(std::move(decoded));
}

std::optional<KSTSystemGroupPathRequest> KSTDecodeSystemGroupPathRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTSystemGroupPathRequest decoded;
  decoded.identifier = in.ownIdentifier(client);
  decoded.groupIdentifier = in.string("GroupIdentifier");
  return in.result(std::move(decoded));
}

std::optional<KSTProcessCodeSigningInfoRequest> KSTDecodeProcessCodeSigningInfoRequest(
    const MessageDictionary& request, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTProcessCodeSigningInfoRequest decoded;
  decoded.codeSigningInfo = in.plist("CodeSigningInfo");
  decoded.identifier = in.string(kIdentifierKey);
  decoded.options = in.plist("OptionsDictionary");
  return in.result(std::move(decoded));
}

std::optional<KSTIdentifierRequest> KSTDecodeIdentifierRequest(const MessageDictionary& request,
                                                               std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTIdentifierRequest decoded;
  decoded.identifier = in.string(kIdentifierKey);
  return in.result(std::move(decoded));
}

std::optional<KSTDataProtectionRequest> KSTDecodeDataProtectionRequest(
    const MessageDictionary& request, const KSTClientConnection& client, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTDataProtectionRequest decoded;
  decoded.containerClass = in.uint64(kContainerClassKey);
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.identifier = in.string(kIdentifierKey);
  const std::int64_t protectionClass = in.int64("DataProtectionClass");
  decoded.isThirdParty = in.boolean("IsThirdParty");
  decoded.retryIfLocked = in.boolean("RetryIfLocked");
  if (in.ok() && (protectionClass < std::numeric_limits<std::int32_t>::min() ||
                  protectionClass > std::numeric_limits<std::int32_t>::max())) {
    KSTLogTag(kLogError, in.tag(), "Request key \"%@\" holds %lld, beyond any protection class",
              "DataProtectionClass", protectionClass);
    in.fail(kKSTErrorInvalidParameter);
  }
  decoded.dataProtectionClass = static_cast<std::int32_t>(protectionClass);
  decoded.userId = in.resolveUser(user, decoded.containerClass, client);
  return in.result(std::move(decoded));
}

std::optional<KSTRetryTestRequest> KSTDecodeRetryTestRequest(const MessageDictionary& request,
                                                             const KSTClientConnection& client,
                                                             std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTRetryTestRequest decoded;
  const std::uint64_t user = in.uint64(kUserIdKey);
  decoded.numRetryCrashes = in.uint64("NumRetryCrashes");
  decoded.userId = in.resolveUser(user, kKSTContainerClassDataApplication, client);
  return in.result(decoded);
}

std::optional<KSTStageSharedContentRequest> KSTDecodeStageSharedContentRequest(
    const MessageDictionary& request, std::uint64_t* error) {
  RequestReader in(request, __func__, error);
  KSTStageSharedContentRequest decoded;
  decoded.identifier = in.string(kIdentifierKey);
  decoded.sourcePath = in.string("SourcePath");
  decoded.destPath = in.string("DestPath");
  return in.result(std::move(decoded));
}

// --- Replies ---

void KSTEncodeContainerReply(const KSTMetadata& container, MessageDictionary* reply) {
  reply->setUuid("ReplyUUID", container.uuid());
  reply->setBoolean("ReplyExisted", container.existed());
  reply->setString("ReplyPath", container.url().path());
  reply->setString("ReplyIdentifier", container.identifier());
}

void KSTEncodeContainerListReply(const std::vector<KSTMetadataRef>& containers,
                                 MessageDictionary* reply) {
  MessageArray identifiers;
  MessageArray uuids;
  identifiers.reserve(containers.size());
  uuids.reserve(containers.size());
  for (const KSTMetadataRef& container : containers) {
    if (!container) continue;
    identifiers.push_back(MessageValue::fromString(container->identifier()));
    uuids.push_back(MessageValue::fromUuid(container->uuid()));
  }
  reply->setArray("ReplyIdsArray", std::move(identifiers));
  reply->setArray("ReplyUUIDsArray", std::move(uuids));
}

void KSTEncodeMetadataReply(const KSTMetadata& container, bool infoDictRequested,
                            MessageDictionary* reply) {
  reply->setString("ReplyPath", container.url().path());
  reply->setBoolean("ReplyTransient", container.transient());
  if (!infoDictRequested) return;
  if (std::optional<PlistDictionary> info = container.info()) {
    if (!reply->setPlist("ReplyInfoDictionary", PlistValue(std::move(*info)))) {
      KSTLog(kLogError, "Info of %@ is nested too deep to send", container);
    }
  }
}

void KSTEncodePathReply(const std::string& path, MessageDictionary* reply) {
  reply->setString("ReplyPath", path);
}

bool KSTEncodePlistReply(const char* key, const PlistValue& value, MessageDictionary* reply) {
  return reply->setPlist(key, value);
}

void KSTEncodeDiskUsageReply(std::uint64_t bytes, MessageDictionary* reply) {
  reply->setUint64("ReplyDiskUsage", bytes);
}

}  // namespace kestrel
