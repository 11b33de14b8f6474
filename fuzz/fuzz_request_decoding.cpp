// Arbitrary request dictionaries, built from the input with the keys of every
// command (and random ones) holding values of every type, decoded by every
// command's decoder for a client whose identity is drawn too. A decoder either
// gives its request with no code, or nothing with the code of bad input; the
// user it resolves follows the rules of validateUserId. What decodes is then
// encoded into the replies that carry such values.
#include <fuzzer/FuzzedDataProvider.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "daemon/client_connection.h"
#include "daemon/command_requests.h"
#include "daemon/error_codes.h"
#include "platform/message_ipc.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/global_configuration.h"
#include "store/metadata.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;
using platform::MessageArray;
using platform::MessageData;
using platform::MessageDictionary;
using platform::MessageValue;

// Every key a decoder reads, and a few it does not.
constexpr const char* kKeys[] = {
    "UserID",
    "ContainerClass",
    "Identifier",
    "UUID",
    "Transient",
    "CreateIfNecessary",
    "OldContainerUUID",
    "OldContainerClass",
    "OldIdentifier",
    "OldContainerUserID",
    "NewContainerClass",
    "NewContainerUserID",
    "NewContainerUUID",
    "NewIdentifier",
    "ContainerClassesArray",
    "UUIDsArray",
    "UserIDsArray",
    "IdentifiersArray",
    "Value",
    "Key",
    "InfoDictRequested",
    "GroupIdentifier",
    "CodeSigningInfo",
    "OptionsDictionary",
    "DataProtectionClass",
    "IsThirdParty",
    "RetryIfLocked",
    "NumRetryCrashes",
    "SourcePath",
    "DestPath",
    "Command",
    "ReplyPath",
};

// Numbers worth drawing often: classes, the special users and type limits.
constexpr std::uint64_t kInterestingNumbers[] = {
    0,
    1,
    2,
    3,
    4,
    7,
    12,
    13,
    14,
    33,
    499,
    500,
    501,
    502,
    0xFFFFFFFFull,
    0x100000000ull,
    0x1000001F5ull,  // 501 in the low 32 bits
    0x7FFFFFFFull,
    0x80000000ull,
    0xFFFFFFFF80000000ull,
    0x7FFFFFFFFFFFFFFFull,
    0x8000000000000000ull,
    0xFFFFFFFFFFFFFFFFull,
};

std::uint64_t drawNumber(FuzzedDataProvider& in) {
  if (in.ConsumeBool()) return in.PickValueInArray(kInterestingNumbers);
  return in.ConsumeIntegral<std::uint64_t>();
}

std::string drawString(FuzzedDataProvider& in) {
  switch (in.ConsumeIntegralInRange(0, 3)) {
    case 0:
      return "com.example.app";
    case 1:
      return "systemgroup.com.example.group";
    default:
      return in.ConsumeRandomLengthString(64);
  }
}

MessageValue drawValue(FuzzedDataProvider& in, int depth);

MessageDictionary drawDictionary(FuzzedDataProvider& in, int depth) {
  MessageDictionary dictionary;
  const int count = in.ConsumeIntegralInRange(0, 6);
  for (int i = 0; i < count && in.remaining_bytes() > 0; ++i) {
    std::string key = in.ConsumeBool() ? std::string(in.PickValueInArray(kKeys)) : drawString(in);
    dictionary.set(std::move(key), drawValue(in, depth + 1));
  }
  return dictionary;
}

// A chain of containers deeper than a message may carry (or just below it).
MessageValue drawDeepValue(FuzzedDataProvider& in) {
  const std::size_t levels = platform::kMaxMessageDepth - 2 + in.ConsumeIntegralInRange(0, 4);
  MessageValue value = MessageValue::fromBoolean(true);
  for (std::size_t i = 0; i < levels; ++i) {
    if (i % 2 == 0) {
      // Moved in, not through an initializer list: that would copy the whole
      // chain at every level.
      MessageArray array;
      array.push_back(std::move(value));
      value = MessageValue::fromArray(std::move(array));
    } else {
      MessageDictionary dictionary;
      dictionary.set("k", std::move(value));
      value = MessageValue::fromDictionary(std::move(dictionary));
    }
  }
  return value;
}

MessageValue drawValue(FuzzedDataProvider& in, int depth) {
  const int kind = in.ConsumeIntegralInRange(0, depth < 6 ? 10 : 7);
  switch (kind) {
    case 0:
      return MessageValue::fromUint64(drawNumber(in));
    case 1:
      return MessageValue::fromInt64(static_cast<std::int64_t>(drawNumber(in)));
    case 2:
      return MessageValue::fromBoolean(in.ConsumeBool());
    case 3:
      return MessageValue::fromString(drawString(in));
    case 4: {  // a UUID
      MessageData bytes = in.ConsumeBytes<std::uint8_t>(16);
      bytes.resize(16);
      return MessageValue::fromData(std::move(bytes));
    }
    case 5:
      return MessageValue::fromData(
          in.ConsumeBytes<std::uint8_t>(in.ConsumeIntegralInRange<std::size_t>(0, 40)));
    case 6:
      return MessageValue::fromReal(in.ConsumeFloatingPoint<double>());
    case 7:
      return MessageValue::fromUint64(in.ConsumeIntegralInRange<std::uint64_t>(0, 14));
    case 8: {
      MessageArray array;
      const int count = in.ConsumeIntegralInRange(0, 6);
      for (int i = 0; i < count && in.remaining_bytes() > 0; ++i) {
        array.push_back(drawValue(in, depth + 1));
      }
      return MessageValue::fromArray(std::move(array));
    }
    case 9:
      return MessageValue::fromDictionary(drawDictionary(in, depth));
    default:
      return drawDeepValue(in);
  }
}

std::unique_ptr<KSTClientConnection> drawClient(FuzzedDataProvider& in) {
  std::optional<std::string> bundleId;
  if (in.ConsumeBool()) bundleId = drawString(in);
  constexpr std::uint32_t kUsers[] = {0, 33, 499, 500, 501, 502, 503, 0xFFFFFFFEu};
  const std::uint32_t user =
      in.ConsumeBool() ? in.PickValueInArray(kUsers) : in.ConsumeIntegral<std::uint32_t>();
  const bool allowOtherIdLookup = in.ConsumeBool();
  std::optional<std::vector<std::string>> wipe;
  if (in.ConsumeBool()) wipe = std::vector<std::string>{drawString(in)};
  return std::make_unique<KSTClientConnection>(std::move(bundleId), user, allowOtherIdLookup,
                                               std::move(wipe));
}

// --- Checks -------------------------------------------------------------------------------

// What validateUserId resolves the requested user of a class to, or nothing
// when it refuses; for a client below the first mobile user every user the
// class allows stands for itself.
std::optional<std::uint32_t> expectedUser(std::uint64_t requested64,
                                          KSTContainerClass containerClass,
                                          std::uint32_t clientUser) {
  const auto requested = static_cast<std::uint32_t>(requested64);
  if (KSTIsBundleClass(containerClass)) {
    return requested == kKSTInstallerUserId ? std::optional(requested) : std::nullopt;
  }
  if (KSTIsSystemClass(containerClass)) {
    return requested == kKSTSystemContainerUserId ? std::optional(requested) : std::nullopt;
  }
  if (clientUser < kKSTFirstMobileUserId) {
    if (requested == kKSTCurrentMobileUserAlias) {
      return KSTGlobalConfiguration::sharedInstance().currentMobileUserId();
    }
    if (KSTUserIdIsValidForClass(containerClass, requested)) return requested;
    return std::nullopt;
  }
  if (requested == clientUser || requested == kKSTCurrentMobileUserAlias) return clientUser;
  return std::nullopt;
}

void checkUser(const char* decoder, std::uint32_t resolved, std::uint64_t requested,
               KSTContainerClass containerClass, const KSTClientConnection& client) {
  const auto expected = expectedUser(requested, containerClass, client.clientUserId());
  KESTREL_FUZZ_CHECK(expected && *expected == resolved,
                     std::string(decoder) + ": user " + std::to_string(requested) + " of class " +
                         std::to_string(containerClass) + " for client " +
                         std::to_string(client.clientUserId()) + " resolved to " +
                         std::to_string(resolved));
}

// The outcome of one decoder: a request and no code, or nothing and a code of bad input.
template <typename T>
const T* checkOutcome(const char* decoder, const std::optional<T>& decoded, std::uint64_t code) {
  if (decoded) {
    KESTREL_FUZZ_CHECK(code == kKSTSuccess, std::string(decoder) + " decoded and set a code");
    return &*decoded;
  }
  KESTREL_FUZZ_CHECK(code == kKSTErrorInvalidParameter || code == kKSTErrorInvalidObject,
                     std::string(decoder) + " refused with code " + std::to_string(code));
  return nullptr;
}

void checkOwnIdentifier(const char* decoder, const std::optional<std::string>& identifier,
                        const MessageDictionary& request, const KSTClientConnection& client) {
  // An "Identifier" of another type reads as absent.
  const auto expected =
      request.string("Identifier") ? request.string("Identifier") : client.clientBundleIdentifier();
  KESTREL_FUZZ_CHECK(identifier == expected, std::string(decoder) + ": own identifier");
}

// A property list decoded from the request goes into a reply intact, or not at all.
void encodePlist(const char* key, const std::optional<PlistValue>& value) {
  if (!value) return;
  MessageDictionary reply;
  if (KSTEncodePlistReply(key, *value, &reply)) {
    const auto back = reply.plist(key);
    KESTREL_FUZZ_CHECK(back && plistEquivalent(*value, *back), key);
  } else {
    KESTREL_FUZZ_CHECK(!reply.contains(key), key);
  }
}

KSTMetadataRef makeRecord(std::uint32_t userId, KSTContainerClass containerClass,
                          const std::optional<platform::Uuid>& uuid,
                          const std::optional<std::string>& identifier,
                          std::optional<PlistDictionary> info) {
  static const KSTFileURL url(environment().resolve("/private/var/fuzz/Container"), true);
  return KSTMetadata::initWithUserId(userId, uuid.value_or(platform::Uuid()), containerClass,
                                     identifier.value_or(""), std::move(info), url);
}

void encodeRecord(const KSTMetadata& record) {
  MessageDictionary reply;
  KSTEncodeContainerReply(record, &reply);
  KESTREL_FUZZ_CHECK(reply.uuid("ReplyUUID") == record.uuid(), record.description());
  KESTREL_FUZZ_CHECK(reply.string("ReplyIdentifier") == record.identifier(), record.description());

  MessageDictionary metadataReply;
  KSTEncodeMetadataReply(record, true, &metadataReply);
  if (const auto info = record.info(); info && metadataReply.contains("ReplyInfoDictionary")) {
    const auto back = metadataReply.plist("ReplyInfoDictionary");
    KESTREL_FUZZ_CHECK(back && plistEquivalent(PlistValue(*info), *back), record.description());
  }
  (void)metadataReply.description();
}

void decodeAll(const MessageDictionary& request, const KSTClientConnection& client) {
  std::vector<KSTMetadataRef> records;
  std::uint64_t code = kKSTSuccess;

  // The decoded optional lives for the whole if statement that declares it.
#define DECODE(name, ...)                                                               \
  auto decoded = (code = kKSTSuccess, name(request __VA_OPT__(, ) __VA_ARGS__, &code)); \
  const auto* d = checkOutcome(#name, decoded, code)

  if (DECODE(KSTDecodeCreateOrLookupRequest, client)) {
    checkUser("create", d->userId, request.uint64("UserID"), d->containerClass, client);
    checkOwnIdentifier("create", d->identifier, request, client);
    records.push_back(makeRecord(d->userId, d->containerClass, std::nullopt, d->identifier, {}));
  }
  if (DECODE(KSTDecodeListContainersRequest, client)) {
    checkUser("list", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeReplaceContainerRequest, client)) {
    if (d->oldContainerUUID) {
      checkUser("replace old", d->oldUserId, request.uint64("OldContainerUserID"),
                d->oldContainerClass, client);
    } else {
      KESTREL_FUZZ_CHECK(d->oldContainerClass == 0 && d->oldUserId == 0 && !d->oldIdentifier,
                         "replace without an old UUID");
    }
    checkUser("replace new", d->newUserId, request.uint64("NewContainerUserID"),
              d->newContainerClass, client);
    records.push_back(
        makeRecord(d->newUserId, d->newContainerClass, d->newContainerUUID, d->newIdentifier, {}));
  }
  if (DECODE(KSTDecodeStageForDeleteRequest, client)) {
    const MessageArray* users = request.array("UserIDsArray");
    KESTREL_FUZZ_CHECK(d->userIds.size() == (users ? users->size() : 0), "stage: user count");
    KESTREL_FUZZ_CHECK(d->containerClasses.size() >= d->userIds.size(), "stage: class count");
    for (std::size_t i = 0; i < d->userIds.size(); ++i) {
      checkUser("stage", d->userIds[i], (*users)[i].uint64().value_or(0),
                d->containerClasses[i].value_or(0), client);
    }
  }
  if (DECODE(KSTDecodeSetInfoValueRequest, client)) {
    checkUser("set info", d->userId, request.uint64("UserID"), d->containerClass, client);
    KESTREL_FUZZ_CHECK(d->value.has_value() == request.contains("Value"), "set info: value");
    encodePlist("ReplyInfoValue", d->value);
    std::optional<PlistDictionary> info;
    if (d->value && d->value->isDictionary()) info = *d->value->dictionary();
    records.push_back(
        makeRecord(d->userId, d->containerClass, d->uuid, d->identifier, std::move(info)));
  }
  if (DECODE(KSTDecodeInfoValueRequest, client)) {
    checkUser("info", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeMetadataRequest, client)) {
    checkUser("metadata", d->userId, request.uint64("UserID"), d->containerClass, client);
    records.push_back(makeRecord(d->userId, d->containerClass, d->uuid, d->identifier, {}));
  }
  if (DECODE(KSTDecodeContainerRequest, client)) {
    checkUser("container", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeDeleteContainerRequest, client)) {
    checkUser("delete", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeWipePluginContainerRequest, client)) {
    KESTREL_FUZZ_CHECK(d->containerClass == kKSTContainerClassDataVantlerPlugin, "wipe plug-in");
    checkUser("wipe plug-in", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeWipeContainerRequest, client)) {
    checkUser("wipe", d->userId, request.uint64("UserID"), d->containerClass, client);
  }
  if (DECODE(KSTDecodeAppGroupRequest, client)) {
    checkUser("app group", d->userId, request.uint64("UserID"), kKSTContainerClassSharedAppGroup,
              client);
    checkOwnIdentifier("app group", d->identifier, request, client);
  }
  if (DECODE(KSTDecodeOwnIdentifierRequest, client)) {
    checkOwnIdentifier("own identifier", d->identifier, request, client);
    if (d->identifier) {
      MessageDictionary reply;
      KSTEncodePathReply(*d->identifier, &reply);
      KESTREL_FUZZ_CHECK(reply.string("ReplyPath") == d->identifier, "path reply");
    }
  }
  if (DECODE(KSTDecodeSystemGroupPathRequest, client)) {
    checkOwnIdentifier("system group path", d->identifier, request, client);
  }
  if (DECODE(KSTDecodeProcessCodeSigningInfoRequest)) {
    encodePlist("ReplyInfoDictionary", d->codeSigningInfo);
    encodePlist("ReplyGroupContainerDict", d->options);
  }
  if (DECODE(KSTDecodeIdentifierRequest)) {
  }
  if (DECODE(KSTDecodeDataProtectionRequest, client)) {
    checkUser("data protection", d->userId, request.uint64("UserID"), d->containerClass, client);
    KESTREL_FUZZ_CHECK(d->dataProtectionClass == request.int64("DataProtectionClass"),
                       "data protection class out of range");
  }
  if (DECODE(KSTDecodeRetryTestRequest, client)) {
    checkUser("retry test", d->userId, request.uint64("UserID"), kKSTContainerClassDataApplication,
              client);
    MessageDictionary reply;
    KSTEncodeDiskUsageReply(d->numRetryCrashes, &reply);
    KESTREL_FUZZ_CHECK(reply.uint64("ReplyDiskUsage") == d->numRetryCrashes, "disk usage reply");
  }
  if (DECODE(KSTDecodeStageSharedContentRequest)) {
  }
#undef DECODE

  for (const KSTMetadataRef& record : records) encodeRecord(*record);
  MessageDictionary listReply;
  KSTEncodeContainerListReply(records, &listReply);
  const MessageArray* ids = listReply.array("ReplyIdsArray");
  const MessageArray* uuids = listReply.array("ReplyUUIDsArray");
  KESTREL_FUZZ_CHECK(
      ids && uuids && ids->size() == records.size() && uuids->size() == records.size(),
      "list reply: counts");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  environment();
  FuzzedDataProvider in(data, size);
  const std::unique_ptr<KSTClientConnection> client = drawClient(in);
  const MessageDictionary request = drawDictionary(in, 0);
  // Rendering the whole request costs a fifth of the run; one input in four
  // is enough for it.
  if (sampled({data, size}, 4)) (void)request.description();
  decodeAll(request, *client);
  return 0;
}
