#include "daemon/command_requests.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <limits>

#include "daemon/error_codes.h"
#include "daemon/request_dispatch.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using platform::MessageArray;
using platform::MessageDictionary;
using platform::MessageValue;
using platform::Uuid;

const Uuid kUuidA = *Uuid::parse("6F1B2C3D-0000-4000-8000-00000000000A");
const Uuid kUuidB = *Uuid::parse("6F1B2C3D-0000-4000-8000-00000000000B");

KSTClientConnection systemClient(std::optional<std::string> id = "com.example.tool") {
  return KSTClientConnection(std::move(id), 0, true, std::nullopt);
}
KSTClientConnection mobileClient(std::uint32_t uid = 501) {
  return KSTClientConnection("com.example.app", uid, false, std::nullopt);
}

MessageValue nestedTooDeep() {
  MessageValue value = MessageValue::fromUint64(1);
  for (std::size_t i = 0; i <= platform::kMaxMessageDepth + 1; ++i) {
    value = MessageValue::fromArray(MessageArray{value});
  }
  return value;
}

// A request naming a class and a user (0: no "UserID").
MessageDictionary classAndUser(std::uint64_t containerClass, std::uint64_t user) {
  MessageDictionary request;
  request.setUint64("ContainerClass", containerClass);
  if (user != 0) request.setUint64("UserID", user);
  return request;
}

// The user a decoder resolves, or nothing when it refuses.
template <auto decode>
std::optional<std::uint32_t> userOf(const MessageDictionary& request,
                                    const KSTClientConnection& client, std::uint64_t* code) {
  const auto decoded = decode(request, client, code);
  return decoded ? std::optional(decoded->userId) : std::nullopt;
}

class CommandRequestsTest : public ::testing::Test {
 protected:
  testing::FakeServices fakes;
};

TEST_F(CommandRequestsTest, MissingKeysReadAsTheirDefaultsAndOwnIdentifierFallsBackToTheClient) {
  MessageDictionary request = classAndUser(2, 1);
  std::uint64_t code = kKSTSuccess;

  auto created = KSTDecodeCreateOrLookupRequest(request, mobileClient(), &code);
  ASSERT_TRUE(created);
  EXPECT_EQ(created->containerClass, 2u);
  EXPECT_EQ(created->userId, 501u);
  EXPECT_EQ(created->identifier, "com.example.app");
  EXPECT_FALSE(created->createIfNecessary);
  EXPECT_FALSE(created->transient);

  KSTClientConnection anonymous = systemClient(std::nullopt);
  EXPECT_EQ(KSTDecodeCreateOrLookupRequest(request, anonymous, &code)->identifier, std::nullopt);

  request.setString("Identifier", "com.example.other");
  EXPECT_EQ(KSTDecodeCreateOrLookupRequest(request, mobileClient(), &code)->identifier,
            "com.example.other");

  // Plain "Identifier" keys do not fall back to the client's identifier.
  request.remove("Identifier");
  auto metadata = KSTDecodeMetadataRequest(request, mobileClient(), &code);
  ASSERT_TRUE(metadata);
  EXPECT_EQ(metadata->identifier, std::nullopt);

  EXPECT_EQ(code, kKSTSuccess);
}

// A key of another type reads as absent, and the decoder goes on as it does
// for an absent key; only a debug line tells.
TEST_F(CommandRequestsTest, WrongTypedKeyReadsAsAbsent) {
  using Check = std::function<bool(const MessageDictionary&)>;
  std::uint64_t code = kKSTSuccess;
  const KSTClientConnection client = mobileClient();
  struct Row {
    const char* key;
    MessageValue value;
    Check readAsAbsent;  // decodes and holds what an absent key gives
  } rows[] = {
      {"ContainerClass", MessageValue::fromString("2"),
       [&](auto& r) {
         return KSTDecodeListContainersRequest(r, client, &code)->containerClass == 0;
       }},
      {"Identifier", MessageValue::fromUint64(7),
       [&](auto& r) {
         return KSTDecodeCreateOrLookupRequest(r, client, &code)->identifier == "com.example.app";
       }},
      {"CreateIfNecessary", MessageValue::fromUint64(1),
       [&](auto& r) {
         return !KSTDecodeCreateOrLookupRequest(r, client, &code)->createIfNecessary;
       }},
      {"UUID", MessageValue::fromData({1, 2, 3}),
       [&](auto& r) { return !KSTDecodeSetInfoValueRequest(r, client, &code)->uuid; }},
      {"DataProtectionClass", MessageValue::fromUint64(3),
       [&](auto& r) {
         return KSTDecodeDataProtectionRequest(r, client, &code)->dataProtectionClass == 0;
       }},
      {"UserIDsArray", MessageValue::fromDictionary({}),
       [&](auto& r) { return KSTDecodeStageForDeleteRequest(r, client, &code)->userIds.empty(); }},
      {"OldContainerUUID", MessageValue::fromString("6F1B2C3D-0000-4000-8000-00000000000A"),
       [&](auto& r) {
         MessageDictionary replace = r;
         replace.setUint64("NewContainerClass", 2);
         replace.setUint64("NewContainerUserID", 501);
         return !KSTDecodeReplaceContainerRequest(replace, client, &code)->oldContainerUUID;
       }},
      {"NumRetryCrashes", MessageValue::fromString("3"),
       [&](auto& r) { return KSTDecodeRetryTestRequest(r, client, &code)->numRetryCrashes == 0; }},
      {"Identifier", MessageValue::fromBoolean(true),
       [&](auto& r) { return !KSTDecodeIdentifierRequest(r, &code)->identifier; }},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.key);
    MessageDictionary request = classAndUser(2, 501);
    request.set(row.key, row.value);
    fakes.logging->clear();
    code = kKSTSuccess;
    EXPECT_TRUE(row.readAsAbsent(request));
    EXPECT_EQ(code, kKSTSuccess);
    ASSERT_EQ(fakes.logging->lines().size(), 1u);
    EXPECT_EQ(fakes.logging->lines()[0].level, 7);
    EXPECT_NE(fakes.logging->lines()[0].message.find("Request key \"" + std::string(row.key) +
                                                     "\" has type"),
              std::string::npos);
  }
  // A user of the wrong type is user 0, which no check accepts.
  MessageDictionary request = classAndUser(2, 0);
  request.setString("UserID", "501");
  EXPECT_FALSE(KSTDecodeCreateOrLookupRequest(request, client, &code));
  EXPECT_EQ(code, kKSTErrorInvalidParameter);
}

TEST_F(CommandRequestsTest, UnreadableOrOutOfRangeValueIsRefusedWith38AndLogged) {
  constexpr std::int64_t kMax = std::numeric_limits<std::int32_t>::max();
  constexpr std::int64_t kMin = std::numeric_limits<std::int32_t>::min();
  struct Row {
    const char* tag;
    std::function<bool(const MessageDictionary&, std::uint64_t*)> decode;
    const char* key;
    MessageValue value;
    const char* message;  // after "Request key \"<key>\" "
  } rows[] = {
      {"KSTDecodeSetInfoValueRequest",
       [](auto& r, auto* e) {
         return KSTDecodeSetInfoValueRequest(r, mobileClient(), e).has_value();
       },
       "Value", nestedTooDeep(), "is nested too deep to read"},
      {"KSTDecodeDataProtectionRequest",
       [](auto& r, auto* e) {
         return KSTDecodeDataProtectionRequest(r, mobileClient(), e).has_value();
       },
       "DataProtectionClass", MessageValue::fromInt64(kMax + 1),
       "holds 2147483648, beyond any protection class"},
      {"KSTDecodeDataProtectionRequest",
       [](auto& r, auto* e) {
         return KSTDecodeDataProtectionRequest(r, mobileClient(), e).has_value();
       },
       "DataProtectionClass", MessageValue::fromInt64(kMin - 1),
       "holds -2147483649, beyond any protection class"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.message);
    MessageDictionary request = classAndUser(2, 501);
    request.set(row.key, row.value);
    fakes.logging->clear();
    std::uint64_t code = kKSTSuccess;
    EXPECT_FALSE(row.decode(request, &code));
    EXPECT_EQ(code, kKSTErrorInvalidParameter);
    ASSERT_EQ(fakes.logging->lines().size(), 1u);
    EXPECT_EQ(fakes.logging->lines()[0].level, 3);
    const std::string message = "Request key \"" + std::string(row.key) + "\" " + row.message;
    EXPECT_TRUE(fakes.logging->contains(row.tag, message));
    EXPECT_FALSE(row.decode(request, nullptr));
  }
  // Protection classes that fit 32 bits are taken as they are.
  for (const std::int64_t value : {std::int64_t{-1}, kMin, kMax}) {
    MessageDictionary request = classAndUser(2, 501);
    request.setInt64("DataProtectionClass", value);
    std::uint64_t code = kKSTSuccess;
    const auto decoded = KSTDecodeDataProtectionRequest(request, mobileClient(), &code);
    ASSERT_TRUE(decoded) << value;
    EXPECT_EQ(decoded->dataProtectionClass, value);
    EXPECT_EQ(code, kKSTSuccess);
  }
}

// validateUserId, and the decoders that check "UserID" with it against their command's class.
TEST_F(CommandRequestsTest, UserIdsResolveByClassAndClient) {
  using Decode = std::function<std::optional<std::uint32_t>(
      const MessageDictionary&, const KSTClientConnection&, std::uint64_t*)>;
  const Decode validate = [](const auto& r, const auto& c,
                             auto* e) -> std::optional<std::uint32_t> {
    std::uint32_t resolved = 77;
    const auto user = static_cast<std::uint32_t>(r.uint64("UserID"));
    if (validateUserId(user, r.uint64("ContainerClass"), c.clientUserId(), &resolved, e)) {
      return resolved;
    }
    EXPECT_EQ(resolved, 77u);  // untouched when refused
    return std::nullopt;
  };
  const Decode create = userOf<KSTDecodeCreateOrLookupRequest>;
  const Decode wipePlugin = userOf<KSTDecodeWipePluginContainerRequest>;
  const Decode appGroup = userOf<KSTDecodeAppGroupRequest>;
  struct Row {
    const char* label;
    Decode decode;
    std::uint64_t containerClass;  // "ContainerClass" of the request
    std::uint64_t user;            // "UserID" of the request; 0: none
    std::uint32_t clientUser;
    std::optional<std::uint32_t> resolved;  // nullopt: 38
  } rows[] = {
      {"system client, user 1 is the current mobile user", validate, 2, 1, 0, 501},
      {"system client, another mobile user", validate, 2, 502, 0, 502},
      {"system client, user 500 is no mobile user", validate, 2, 500, 0, std::nullopt},
      {"bundle class needs the installer", validate, 1, 33, 0, 33},
      {"bundle class refuses user 1", validate, 3, 1, 0, std::nullopt},
      {"system class needs 499", validate, 12, 499, 501, 499},
      {"system group class refuses 0", validate, 13, 0, 0, std::nullopt},
      {"class 14 is never valid", validate, 14, 501, 0, std::nullopt},
      {"user process names user 1", validate, 7, 1, 501, 501},
      {"user process names another user", validate, 2, 502, 501, std::nullopt},
      {"decoded: bundle class takes the installer", create, 1, 33, 0, 33},
      {"decoded: only the low 32 bits count", create, 2, (std::uint64_t{7} << 32) | 502, 0, 502},
      {"decoded: mobile client names another user", create, 2, 502, 501, std::nullopt},
      {"decoded: wipe ignores the request's class (4)", wipePlugin, 1, 501, 0, 501},
      {"decoded: wipe checks against class 4", wipePlugin, 2, 33, 0, std::nullopt},
      {"decoded: app groups refuse the installer", appGroup, 1, 33, 0, std::nullopt},
      {"decoded: missing user is 0, never valid", create, 2, 0, 0, std::nullopt},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    const MessageDictionary request = classAndUser(row.containerClass, row.user);
    const KSTClientConnection client("com.example.client", row.clientUser, false, std::nullopt);
    std::uint64_t code = kKSTSuccess;
    EXPECT_EQ(row.decode(request, client, &code), row.resolved);
    EXPECT_EQ(code, row.resolved ? kKSTSuccess : kKSTErrorInvalidParameter);
  }
  EXPECT_TRUE(
      fakes.logging->contains("validateUserId", "Invalid userId 502 for class 2 from client 501"));
  EXPECT_EQ(KSTDecodeWipePluginContainerRequest(classAndUser(1, 501), systemClient(), nullptr)
                ->containerClass,
            kKSTContainerClassDataVantlerPlugin);
  fakes.logging->clear();
  EXPECT_FALSE(validateUserId(502, 2, 501, nullptr, nullptr));
  EXPECT_TRUE(fakes.logging->lines().empty());  // no code pointer: no log line
}

TEST_F(CommandRequestsTest, ReplaceReadsTheOldKeysOnlyWithAnOldUUID) {
  MessageDictionary request;
  request.setUint64("NewContainerClass", 2);
  request.setUint64("NewContainerUserID", 1);
  request.setUuid("NewContainerUUID", kUuidB);
  request.setString("NewIdentifier", "com.example.new");
  request.setString("OldContainerClass", "ignored");  // not read without "OldContainerUUID"
  request.setUint64("OldContainerUserID", 502);
  request.setString("OldIdentifier", "com.example.old");
  std::uint64_t code = kKSTSuccess;

  auto decoded = KSTDecodeReplaceContainerRequest(request, mobileClient(), &code);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->oldContainerUUID, std::nullopt);
  EXPECT_EQ(decoded->oldIdentifier, std::nullopt);
  EXPECT_EQ(decoded->newUserId, 501u);
  EXPECT_EQ(decoded->newContainerUUID, kUuidB);

  // With it, the old class of the wrong type is class 0, which takes no user.
  request.setUuid("OldContainerUUID", kUuidA);
  EXPECT_FALSE(KSTDecodeReplaceContainerRequest(request, mobileClient(), &code));
  EXPECT_TRUE(fakes.logging->containsMessage("Invalid userId 502 for class 0 from client 501"));

  request.setUint64("OldContainerClass", 2);
  code = kKSTSuccess;
  EXPECT_FALSE(KSTDecodeReplaceContainerRequest(request, mobileClient(), &code));  // old user 502
  EXPECT_EQ(code, kKSTErrorInvalidParameter);

  request.setUint64("OldContainerUserID", 501);
  code = kKSTSuccess;
  decoded = KSTDecodeReplaceContainerRequest(request, mobileClient(), &code);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->oldContainerClass, 2u);
  EXPECT_EQ(decoded->oldIdentifier, "com.example.old");
}

TEST_F(CommandRequestsTest, StageForDeleteArrays) {
  MessageDictionary request;
  request.setArray("UserIDsArray", {MessageValue::fromUint64(1), MessageValue::fromUint64(33)});
  request.setArray("ContainerClassesArray",
                   {MessageValue::fromUint64(2), MessageValue::fromUint64(1),
                    MessageValue::fromString("extra")});
  request.setArray("UUIDsArray", {MessageValue::fromUuid(kUuidA), MessageValue::fromString("x")});
  request.setArray("IdentifiersArray",
                   {MessageValue::fromString("com.example.a"), MessageValue::fromUint64(3)});
  std::uint64_t code = kKSTSuccess;

  auto decoded = KSTDecodeStageForDeleteRequest(request, systemClient(), &code);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->userIds, (std::vector<std::uint32_t>{501, 33}));
  EXPECT_EQ(decoded->containerClasses,
            (std::vector<std::optional<KSTContainerClass>>{2, 1, std::nullopt}));
  EXPECT_EQ(decoded->uuids, (std::vector<std::optional<Uuid>>{kUuidA, std::nullopt}));
  EXPECT_EQ(decoded->identifiers,
            (std::vector<std::optional<std::string>>{"com.example.a", std::nullopt}));

  // An identifiers value that is no array is logged and read as nothing.
  request.setString("IdentifiersArray", "com.example.a");
  decoded = KSTDecodeStageForDeleteRequest(request, systemClient(), &code);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->identifiers, std::nullopt);
  EXPECT_TRUE(fakes.logging->contains("stageContainerForDelete",
                                      "Got non-Array input for the identifiers array"));
  EXPECT_EQ(code, kKSTSuccess);

  // A class entry that is no number counts as class 0 for its user.
  request.setArray("ContainerClassesArray",
                   {MessageValue::fromUint64(2), MessageValue::fromString("1")});
  EXPECT_FALSE(KSTDecodeStageForDeleteRequest(request, systemClient(), &code));
  EXPECT_EQ(code, kKSTErrorInvalidParameter);
  EXPECT_TRUE(fakes.logging->containsMessage("Invalid userId 33 for class 0 from client 0"));

  // Fewer classes than user ids.
  request.setArray("ContainerClassesArray", {MessageValue::fromUint64(2)});
  code = kKSTSuccess;
  EXPECT_FALSE(KSTDecodeStageForDeleteRequest(request, systemClient(), &code));
  EXPECT_EQ(code, kKSTErrorInvalidObject);
  EXPECT_TRUE(fakes.logging->contains("KSTDecodeStageForDeleteRequest",
                                      "Can't act on an invalid input: 2 user ids, 1 classes"));
}

TEST_F(CommandRequestsTest, ContainerRepliesCarryPathUUIDAndIdentifier) {
  auto first = KSTMetadata::initWithUserId(501, kUuidA, 2, "com.example.a", std::nullopt,
                                           KSTFileURL("/c/Data/Application/A", true));
  auto second = KSTMetadata::initWithUserId(501, kUuidB, 2, "com.example.b", std::nullopt,
                                            KSTFileURL("/c/Data/Application/B", true));
  second->setTransient(true);
  second->setExisted(true);

  MessageDictionary list;
  KSTEncodeContainerListReply({first, second}, &list);
  EXPECT_EQ(*list.array("ReplyIdsArray"),
            (MessageArray{MessageValue::fromString("com.example.a"),
                          MessageValue::fromString("com.example.b")}));
  EXPECT_EQ(*list.array("ReplyUUIDsArray"),
            (MessageArray{MessageValue::fromUuid(kUuidA), MessageValue::fromUuid(kUuidB)}));

  MessageDictionary created;
  KSTEncodeContainerReply(*second, &created);
  EXPECT_EQ(created.uuid("ReplyUUID"), kUuidB);
  EXPECT_TRUE(created.boolean("ReplyExisted"));
  EXPECT_EQ(created.string("ReplyPath"), "/c/Data/Application/B");
  EXPECT_EQ(created.string("ReplyIdentifier"), "com.example.b");

  // Whether the info dictionary goes along is checked through the handler.
  MessageDictionary metadata;
  KSTEncodeMetadataReply(*second, false, &metadata);
  EXPECT_EQ(metadata.string("ReplyPath"), "/c/Data/Application/B");
  EXPECT_TRUE(metadata.boolean("ReplyTransient"));
}

}  // namespace
}  // namespace kestrel
