#include "daemon/command_requests.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <limits>

#include "daemon/error_codes.h"
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

class CommandRequestsTest : public ::testing::Test {
 protected:
  testing::FakeServices fakes;
};

TEST_F(CommandRequestsTest, MissingKeysReadAsTheirDefaultsAndOwnIdentifierFallsBackToTheClient) {
  MessageDictionary request;
  request.setUint64("ContainerClass", 2);
  request.setUint64("UserID", 1);
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

TEST_F(CommandRequestsTest, WrongTypedKeyIsRefusedWith38AndLogged) {
  using Decode = std::function<bool(const MessageDictionary&, std::uint64_t*)>;
  const KSTClientConnection client = mobileClient();
  const Decode create = [&](const MessageDictionary& r, std::uint64_t* e) {
    return KSTDecodeCreateOrLookupRequest(r, client, e).has_value();
  };
  const Decode setInfo = [&](const MessageDictionary& r, std::uint64_t* e) {
    return KSTDecodeSetInfoValueRequest(r, client, e).has_value();
  };
  const Decode protection = [&](const MessageDictionary& r, std::uint64_t* e) {
    return KSTDecodeDataProtectionRequest(r, client, e).has_value();
  };
  const Decode stage = [&](const MessageDictionary& r, std::uint64_t* e) {
    return KSTDecodeStageForDeleteRequest(r, client, e).has_value();
  };
  struct Row {
    const char* tag;
    Decode decode;
    const char* key;
    MessageValue value;
    const char* message;
  } rows[] = {
      {"KSTDecodeCreateOrLookupRequest", create, "ContainerClass", MessageValue::fromString("2"),
       "Request key \"ContainerClass\" holds a string, not a uint64"},
      {"KSTDecodeCreateOrLookupRequest", create, "Identifier", MessageValue::fromUint64(7),
       "Request key \"Identifier\" holds a uint64, not a string"},
      {"KSTDecodeCreateOrLookupRequest", create, "CreateIfNecessary", MessageValue::fromUint64(1),
       "Request key \"CreateIfNecessary\" holds a uint64, not a boolean"},
      {"KSTDecodeSetInfoValueRequest", setInfo, "UUID", MessageValue::fromData({1, 2, 3}),
       "Request key \"UUID\" holds a data, not a UUID"},
      {"KSTDecodeSetInfoValueRequest", setInfo, "Value", nestedTooDeep(),
       "Request key \"Value\" is nested too deep to read"},
      {"KSTDecodeDataProtectionRequest", protection, "DataProtectionClass",
       MessageValue::fromUint64(3),
       "Request key \"DataProtectionClass\" holds a uint64, not a int64"},
      {"KSTDecodeStageForDeleteRequest", stage, "UserIDsArray", MessageValue::fromDictionary({}),
       "Request key \"UserIDsArray\" holds a dictionary, not a array"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.message);
    MessageDictionary request;
    request.setUint64("ContainerClass", 2);
    request.setUint64("UserID", 501);
    request.set(row.key, row.value);
    fakes.logging->clear();
    std::uint64_t code = kKSTSuccess;
    EXPECT_FALSE(row.decode(request, &code));
    EXPECT_EQ(code, kKSTErrorInvalidParameter);
    ASSERT_EQ(fakes.logging->lines().size(), 1u);
    EXPECT_EQ(fakes.logging->lines()[0].level, 3);
    EXPECT_TRUE(fakes.logging->contains(row.tag, row.message));
    EXPECT_FALSE(row.decode(request, nullptr));
  }
}

TEST_F(CommandRequestsTest, UserIdsAreCheckedAgainstTheCommandsClass) {
  using Decode = std::function<std::optional<std::uint32_t>(
      const MessageDictionary&, const KSTClientConnection&, std::uint64_t*)>;
  const Decode create = [](const auto& r, const auto& c, auto* e) -> std::optional<std::uint32_t> {
    auto d = KSTDecodeCreateOrLookupRequest(r, c, e);
    return d ? std::optional(d->userId) : std::nullopt;
  };
  const Decode wipePlugin = [](const auto& r, const auto& c,
                               auto* e) -> std::optional<std::uint32_t> {
    auto d = KSTDecodeWipePluginContainerRequest(r, c, e);
    if (d) {
      EXPECT_EQ(d->containerClass, kKSTContainerClassDataVantlerPlugin);
    }
    return d ? std::optional(d->userId) : std::nullopt;
  };
  const Decode appGroup = [](const auto& r, const auto& c,
                             auto* e) -> std::optional<std::uint32_t> {
    auto d = KSTDecodeAppGroupRequest(r, c, e);
    return d ? std::optional(d->userId) : std::nullopt;
  };
  struct Row {
    const char* label;
    Decode decode;
    std::uint64_t containerClass;  // "ContainerClass" of the request
    std::uint64_t user;
    std::uint32_t clientUser;
    std::optional<std::uint32_t> resolved;  // nullopt: 38
  } rows[] = {
      {"bundle class takes the installer", create, 1, 33, 0, 33},
      {"only the low 32 bits count", create, 2, (std::uint64_t{7} << 32) | 502, 0, 502},
      {"mobile client names another user", create, 2, 502, 501, std::nullopt},
      {"wipe ignores the request's class (4)", wipePlugin, 1, 501, 0, 501},
      {"wipe checks against class 4", wipePlugin, 2, 33, 0, std::nullopt},
      {"app groups refuse the installer", appGroup, 1, 33, 0, std::nullopt},
      {"missing user is 0, never valid", create, 2, 0, 0, std::nullopt},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    MessageDictionary request;
    request.setUint64("ContainerClass", row.containerClass);
    if (row.user != 0) request.setUint64("UserID", row.user);
    const KSTClientConnection client("com.example.client", row.clientUser, false, std::nullopt);
    std::uint64_t code = kKSTSuccess;
    EXPECT_EQ(row.decode(request, client, &code), row.resolved);
    EXPECT_EQ(code, row.resolved ? kKSTSuccess : kKSTErrorInvalidParameter);
  }
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

  request.setUuid("OldContainerUUID", kUuidA);
  EXPECT_FALSE(KSTDecodeReplaceContainerRequest(request, mobileClient(), &code));
  EXPECT_TRUE(
      fakes.logging->contains("KSTDecodeReplaceContainerRequest",
                              "Request key \"OldContainerClass\" holds a string, not a uint64"));

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

TEST_F(CommandRequestsTest, ProtectionClassMustFitThirtyTwoBits) {
  constexpr std::int64_t kMax = std::numeric_limits<std::int32_t>::max();
  constexpr std::int64_t kMin = std::numeric_limits<std::int32_t>::min();
  const struct {
    std::int64_t value;
    bool accepted;
  } rows[] = {{-1, true}, {kMin, true}, {kMax, true}, {kMax + 1, false}, {kMin - 1, false}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.value);
    MessageDictionary request;
    request.setUint64("ContainerClass", 2);
    request.setUint64("UserID", 501);
    request.setInt64("DataProtectionClass", row.value);
    std::uint64_t code = kKSTSuccess;
    auto decoded = KSTDecodeDataProtectionRequest(request, mobileClient(), &code);
    ASSERT_EQ(decoded.has_value(), row.accepted);
    if (row.accepted) {
      EXPECT_EQ(decoded->dataProtectionClass, row.value);
    }
    EXPECT_EQ(code, row.accepted ? kKSTSuccess : kKSTErrorInvalidParameter);
  }
}

TEST_F(CommandRequestsTest, ContainerRepliesCarryPathUUIDAndIdentifier) {
  auto first = KSTMetadata::initWithUserId(501, kUuidA, 2, "com.example.a", std::nullopt,
                                           KSTFileURL("/c/Data/Application/A", true));
  auto second =
      KSTMetadata::initWithUserId(501, kUuidB, 2, "com.example.b", PlistDictionary{{"k", "v"}},
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

  struct Row {
    const char* label;
    const KSTMetadataRef& container;
    bool requested;
    bool hasInfo;
  } rows[] = {
      {"info asked for and present", second, true, true},
      {"info present but not asked for", second, false, false},
      {"info asked for but absent", first, true, false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    MessageDictionary reply;
    KSTEncodeMetadataReply(*row.container, row.requested, &reply);
    EXPECT_EQ(reply.string("ReplyPath"), row.container->url().path());
    EXPECT_EQ(reply.boolean("ReplyTransient"), row.container->transient());
    EXPECT_EQ(reply.contains("ReplyInfoDictionary"), row.hasInfo);
    if (row.hasInfo) {
      EXPECT_EQ(reply.plist("ReplyInfoDictionary"), PlistValue(*row.container->info()));
    }
  }
}

}  // namespace
}  // namespace kestrel
