// kestrelctl's replies for people.
#include "kestrelctl/human_output.h"

#include <gtest/gtest.h>

namespace kestrel::kestrelctl {
namespace {

using platform::MessageArray;
using platform::MessageDictionary;
using platform::MessageValue;
using platform::Uuid;

const Uuid kFirst = *Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427");
const Uuid kSecond = *Uuid::parse("6D3F0A52-0C4B-4F0E-9C1E-2B7A4E5D6C7F");

MessageValue text(const char* s) {
  return MessageValue::fromString(s);
}

TEST(KestrelctlHumanOutputTest, CreateAndInfoRepliesAreOneLinePerFact) {
  MessageDictionary reply;
  reply.setUint64("ReplyError", 1);
  reply.setString("ReplyIdentifier", "com.example.app");
  reply.setString("ReplyPath", "/private/var/mobile/Containers/Data/Application/6D3F");
  reply.setUuid("ReplyUUID", kFirst);
  reply.setBoolean("ReplyExisted", false);
  EXPECT_EQ(renderReply(Subcommand::Create, reply),
            "identifier  com.example.app\n"
            "path        /private/var/mobile/Containers/Data/Application/6D3F\n"
            "uuid        1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
            "existed     no\n");

  // A reply short of keys, or with a UUID of the wrong length, shows "-".
  MessageDictionary partial;
  partial.setBoolean("ReplyExisted", true);
  partial.setData("ReplyUUID", {1, 2, 3});
  EXPECT_EQ(renderReply(Subcommand::Lookup, partial),
            "identifier  -\n"
            "path        -\n"
            "uuid        -\n"
            "existed     yes\n");

  // Code-signing information shows nested values indented.
  MessageDictionary entitlements;
  entitlements.setBoolean("com.example.allowed", true);
  MessageDictionary info;
  info.setString("SigningIdentifier", "com.example.app");
  info.setArray("Groups", {text("group.a"), text("group.b")});
  info.setDictionary("Entitlements", std::move(entitlements));
  info.setUint64("Team", 7);
  MessageDictionary infoReply;
  infoReply.setDictionary("ReplyInfoDictionary", std::move(info));
  EXPECT_EQ(renderReply(Subcommand::CodeSigningInfo, infoReply),
            "Entitlements\n"
            "  com.example.allowed  true\n"
            "Groups\n"
            "  - group.a\n"
            "  - group.b\n"
            "SigningIdentifier  com.example.app\n"
            "Team               7\n");
}

TEST(KestrelctlHumanOutputTest, ListReplyIsATableWithACount) {
  const auto listReply = [](MessageArray identifiers, MessageArray uuids) {
    MessageDictionary reply;
    reply.setUint64("ReplyError", 1);
    reply.setArray("ReplyIdsArray", std::move(identifiers));
    reply.setArray("ReplyUUIDsArray", std::move(uuids));
    return reply;
  };
  struct Row {
    const char* name;
    MessageDictionary reply;
    const char* text;
  };
  const Row rows[] = {
      {"two",
       listReply({text("com.example.app"), text("com.example.longer-name")},
                 {MessageValue::fromUuid(kFirst), MessageValue::fromUuid(kSecond)}),
       "IDENTIFIER               UUID\n"
       "com.example.app          1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
       "com.example.longer-name  6D3F0A52-0C4B-4F0E-9C1E-2B7A4E5D6C7F\n"
       "2 containers\n"},
      {"one", listReply({text("a")}, {MessageValue::fromUuid(kFirst)}),
       "IDENTIFIER  UUID\n"
       "a           1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
       "1 container\n"},
      {"empty", listReply({}, {}), "0 containers\n"},
      {"no arrays", MessageDictionary(), "0 containers\n"},
      {"uneven",
       listReply({text("a"), MessageValue::fromUint64(7)}, {MessageValue::fromUuid(kFirst)}),
       "IDENTIFIER  UUID\n"
       "a           1B4E28BA-2FA1-11D2-883F-0016D3CCA427\n"
       "-           -\n"
       "2 containers\n"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    EXPECT_EQ(renderReply(Subcommand::List, row.reply), row.text);
  }
}

TEST(KestrelctlHumanOutputTest, FailuresNameWellKnownCodes) {
  struct Row {
    std::uint64_t code;
    const char* message;
  };
  const Row rows[] = {
      {21, "kestrelctl: lookup failed: error 21 (not found)"},
      {11, "kestrelctl: lookup failed: error 11 (invalid object)"},
      {38, "kestrelctl: lookup failed: error 38 (invalid parameter)"},
      {55, "kestrelctl: lookup failed: error 55 (not entitled)"},
      {0, "kestrelctl: lookup failed: error 0"},
      {2, "kestrelctl: lookup failed: error 2"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.code);
    EXPECT_EQ(failureMessage("lookup", row.code), row.message);
  }
}

TEST(KestrelctlHumanOutputTest, UsageIsShownInBinaryUnitsBesideTheExactBytes) {
  const struct {
    std::uint64_t bytes;
    const char* human;
  } rows[] = {
      {0, "0 B"},
      {1023, "1023 B"},
      {1024, "1.0 KiB"},
      {1536, "1.5 KiB"},
      {1024 * 1024 - 1, "1.0 MiB"},  // not "1024.0 KiB"
      {std::uint64_t{5} << 30, "5.0 GiB"},
      {~std::uint64_t{0}, "16.0 EiB"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.bytes);
    EXPECT_EQ(humanBytes(row.bytes), row.human);
  }
  platform::MessageDictionary reply;
  reply.setUint64("ReplyDiskUsage", 1536);
  EXPECT_EQ(renderReply(Subcommand::Usage, reply), "usage  1.5 KiB\nbytes  1536\n");
}

}  // namespace
}  // namespace kestrel::kestrelctl
