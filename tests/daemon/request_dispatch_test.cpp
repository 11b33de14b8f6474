#include "daemon/request_dispatch.h"

#include <gtest/gtest.h>

#include "codesigning/code_signing_mapping.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "store/container_cache.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

using platform::MessageDictionary;

constexpr pid_t kClientPid = 4242;

class RequestDispatchTest : public ::testing::Test {
 protected:
  RequestDispatchTest() {
    EXPECT_TRUE(
        KSTStartRequestListener(platform::DispatchQueue::createConcurrent("test.listener")));
  }

  std::shared_ptr<platform::FakeMessageConnection> connect(
      uid_t uid, std::optional<PlistDictionary> entitlements,
      std::optional<std::string> identifier = "com.example.client") {
    platform::CodeSigningIdentityResult identity;
    identity.signingIdentifier = std::move(identifier);
    identity.entitlements = std::move(entitlements);
    if (!identity.signingIdentifier) identity.error = "not signed";
    fakes.codeSigningIdentity->setIdentityForPid(kClientPid, identity);
    platform::PeerCredentials peer;
    peer.pid = kClientPid;
    peer.uid = uid;
    peer.gid = uid;
    connection = fakes.messageIPC->connect(peer);
    return connection;
  }

  std::unique_ptr<KSTClientConnection> admit(std::uint64_t command) {
    return checkEntitlementsAndInitClientObject(*connection, KSTCommandTable()[command]);
  }

  static MessageDictionary request(std::uint64_t command) {
    MessageDictionary message;
    message.setUint64("Command", command);
    return message;
  }

  testing::FakeServices fakes;
  std::shared_ptr<platform::FakeMessageConnection> connection;
};

TEST_F(RequestDispatchTest, AdmissionFollowsTheEntitlements) {
  const PlistDictionary none;
  const PlistDictionary unrelated{{"com.example.entitlement", true}};
  const PlistDictionary allowed{{kKSTEntitlementAllowed, true}};
  const PlistDictionary allowedAsString{{kKSTEntitlementAllowed, "true"}};
  const PlistDictionary wipeArray{{kKSTEntitlementWipeContainer, PlistArray{"com.a", 5, "com.b"}}};
  const PlistDictionary wipeBool{{kKSTEntitlementWipeContainer, true}};
  const PlistDictionary migration{{kKSTEntitlementDataMigration, true}};

  struct Row {
    const char* label;
    std::optional<PlistDictionary> entitlements;
    std::vector<std::uint64_t> admitted;
  };
  const std::vector<std::uint64_t> noneCommands{0, 13, 15, 16, 17};
  std::vector<std::uint64_t> allowedCommands;
  for (std::uint64_t i = 0; i < kKSTCommandCount; ++i) {
    if (i != 24 && i != 26) allowedCommands.push_back(i);
  }
  const Row rows[] = {
      {"no entitlements at all", std::nullopt, {}},
      {"an empty dictionary is no entitlements", none, {}},
      {"entitlements but no Kestrel key", unrelated, noneCommands},
      {"allowed", allowed, allowedCommands},
      {"allowed of the wrong type", allowedAsString, noneCommands},
      {"wipe array", wipeArray, {0, 11, 13, 15, 16, 17}},
      {"wipe not an array", wipeBool, noneCommands},
      {"data migration", migration, {0, 13, 15, 16, 17, 24}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    connect(501, row.entitlements);
    for (std::uint64_t command = 0; command < kKSTCommandCount; ++command) {
      SCOPED_TRACE(command);
      const bool expected =
          std::find(row.admitted.begin(), row.admitted.end(), command) != row.admitted.end();
      EXPECT_EQ(admit(command) != nullptr, expected);
    }
  }
}

// The refusal's log line is checked end to end.
TEST_F(RequestDispatchTest, AdmittedClientCarriesItsIdentityAndRights) {
  connect(501, PlistDictionary{{kKSTEntitlementWipeContainer, PlistArray{"com.a", 5, "com.b"}},
                               {kKSTEntitlementOtherIdLookup, true}});
  auto client = admit(11);
  ASSERT_NE(client, nullptr);
  EXPECT_EQ(client->clientBundleIdentifier(), "com.example.client");
  EXPECT_EQ(client->clientUserId(), 501u);
  EXPECT_TRUE(client->allowOtherIdLookup());
  EXPECT_FALSE(client->allowGroupIdLookup());
  EXPECT_EQ(client->entitledWipeIdentifiers(), (std::vector<std::string>{"com.a", "com.b"}));

  connect(0, PlistDictionary{{kKSTEntitlementAllowed, true}});
  client = admit(11);
  ASSERT_NE(client, nullptr);
  EXPECT_TRUE(client->allowOtherIdLookup());
  EXPECT_FALSE(client->entitledWipeIdentifiers().has_value());
  EXPECT_TRUE(fakes.logging->containsMessage("No entitled containers to wipe"));

  // A peer without entitlements is refused silently; one whose identifier
  // cannot be read is admitted, acting with no own identifier.
  fakes.logging->clear();
  connect(501, std::nullopt);
  EXPECT_EQ(admit(0), nullptr);
  EXPECT_TRUE(fakes.logging->lines().empty());
  connect(501, PlistDictionary{{"com.example.entitlement", true}}, std::nullopt);
  client = admit(0);
  ASSERT_NE(client, nullptr);
  EXPECT_FALSE(client->clientBundleIdentifier().has_value());
  EXPECT_TRUE(
      fakes.logging->containsMessage("Failed to copy signing ID for pid 4242 : not signed"));
}

// While its application is held terminated, a client is not served at all.
TEST_F(RequestDispatchTest, ClientsHeldTerminatedAreRefused) {
  connect(501, PlistDictionary{{kKSTEntitlementAllowed, true}});
  auto held = fakes.applicationLifecycle->acquireTerminationAssertion(
      "com.example.client", platform::TerminationReason::Installation, [](const auto&) {});
  EXPECT_EQ(admit(0), nullptr);
  EXPECT_TRUE(fakes.logged(
      "connection attempt from pid 4242 (com.example.client) refused: it is held terminated"));
  held->invalidate();
  EXPECT_NE(admit(0), nullptr);
}

// Index 27 and a refusal are checked end to end.
TEST_F(RequestDispatchTest, RequestsThatCannotBeServedCloseTheConnectionWithoutReply) {
  struct Row {
    const char* label;
    std::uint64_t command;
    bool expectReply;
    bool internalBuild;
    const char* logged;  // nullptr: nothing in particular
  } rows[] = {
      // The index is logged as a signed number.
      {"huge command index", std::uint64_t{1} << 63, true, false,
       "Invalid command index: -9223372036854775808"},
      {"no reply context", 25, false, false, "Dictionary does not have reply context"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    fakes.deviceInfo->setInternalBuild(row.internalBuild);
    connect(501, PlistDictionary{{kKSTEntitlementAllowed, true}});
    auto message = request(row.command);
    message.setUint64("UserID", 501);
    if (row.internalBuild) message.setUint64("NumRetryCrashes", 3);
    connection->deliver(message, row.expectReply);
    EXPECT_TRUE(connection->cancelled());
    EXPECT_TRUE(connection->replies().empty());
    if (row.logged != nullptr) {
      EXPECT_TRUE(fakes.logging->containsMessage(row.logged));
    }
  }
}

TEST_F(RequestDispatchTest, AClientsOwnEntitlementsAreRegisteredOnItsFirstRequest) {
  KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
  connect(501, PlistDictionary{{kKSTSystemContainerEntitlement, true}});
  EXPECT_FALSE(mapping.identifierHasCallerRegisteredEntitlements("com.example.client"));

  // Command 15 without an identifier: the client's own system container.
  ASSERT_TRUE(connection->deliver(request(15)));
  EXPECT_TRUE(mapping.identifierHasCallerRegisteredEntitlements("com.example.client"));
  auto reply = connection->lastReply();
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ(reply->uint64("ReplyError"), kKSTSuccess);
  KSTErrorRef error;
  const KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
      kKSTSystemContainerUserId, kKSTContainerClassDataSystem, "com.example.client", false, &error);
  ASSERT_TRUE(container);
  EXPECT_EQ(reply->string("ReplyPath"), container->url().path());
  EXPECT_FALSE(
      fakes.logging->containsMessage("Error processing entitlements for com.example.client"));
}

}  // namespace
}  // namespace kestrel
