// kestrelctl's named subcommands and request items: option parsing and the
// requests they send.
#include "kestrelctl/commands.h"

#include <gtest/gtest.h>

#include "kestrelctl/request_items.h"
#include "store/container_class.h"

namespace kestrel::kestrelctl {
namespace {

TEST(KestrelctlCommandsTest, ParsesClassesAndUserIds) {
  // Every class by the daemon's own name for it.
  ASSERT_EQ(containerClassNames().size(), 13u);
  for (std::uint64_t c = 1; c <= 13; ++c) {
    SCOPED_TRACE(c);
    EXPECT_EQ(containerClassNames()[c - 1], KSTContainerClassPath(c));
    std::string error;
    EXPECT_EQ(parseContainerClass(KSTContainerClassPath(c), &error), c) << error;
  }
  struct Row {
    const char* text;
    std::optional<std::uint64_t> containerClass;
    const char* errorPart;  // when no class
  };
  const Row rows[] = {
      {"2", 2, ""},
      {"0", 0, ""},  // bounds go to the daemon, which answers for them
      {"14", 14, ""},
      {"18446744073709551615", UINT64_MAX, ""},
      {"data/application", 2, ""},
      {"SHARED/SYSTEMGROUP", 13, ""},
      {"18446744073709551616", std::nullopt, "not a number between 0 and 18446744073709551615"},
      {"-1", std::nullopt, "\"-1\" is not a number"},
      {"+2", std::nullopt, "not a number"},
      {"2x", std::nullopt, "not a number"},
      {"Data/Applications", std::nullopt, "unknown container class \"Data/Applications\""},
      {"Application", std::nullopt, "Bundle/Application, Data/Application"},
      {"", std::nullopt, "unknown container class"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.text);
    std::string error;
    EXPECT_EQ(parseContainerClass(row.text, &error), row.containerClass);
    if (!row.containerClass) {
      EXPECT_NE(error.find("--class"), std::string::npos) << error;
      EXPECT_NE(error.find(row.errorPart), std::string::npos) << error;
    }
  }

  std::string error;
  EXPECT_EQ(parseUnsignedOption("--user", "501", &error), 501u);
  EXPECT_EQ(parseUnsignedOption("--user", " 501", &error), std::nullopt);
  EXPECT_EQ(parseUnsignedOption("--user", "0x1f5", &error), std::nullopt);
  EXPECT_EQ(parseUnsignedOption("--user", "-501", &error), std::nullopt);
  EXPECT_EQ(error, "--user: \"-501\" is not a number between 0 and 18446744073709551615");
}

// The request as "key=type:value" items in key order, for comparing whole requests.
std::string describe(const platform::MessageDictionary& request) {
  std::string out;
  for (const auto& [key, value] : request.entries()) {
    out += (out.empty() ? "" : " ") + key + "=";
    if (auto u = value.uint64()) {
      out += "u64:" + std::to_string(*u);
    } else if (auto i = value.int64()) {
      out += "i64:" + std::to_string(*i);
    } else if (auto uuid = value.uuid()) {
      out += "uuid:" + uuid->string();
    } else if (auto b = value.boolean()) {
      out += std::string("bool:") + (*b ? "true" : "false");
    } else {
      out += value.string() ? "str:" + *value.string() : "?";
    }
  }
  return out;
}

TEST(KestrelctlCommandsTest, BuildsTheRequestOfEachSubcommandOrSaysWhatIsMissing) {
  RequestOptions full{2, 501, "com.example.app", true};
  RequestOptions noIdentifier{2, 501, std::nullopt, false};
  RequestOptions noClass{std::nullopt, 501, std::nullopt, false};
  RequestOptions noUser{2, std::nullopt, std::nullopt, false};
  const platform::Uuid uuid = *platform::Uuid::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  RequestOptions info = full;
  info.uuid = uuid;
  info.key = "k";
  info.value = PlistValue(7);
  info.infoDictionary = true;
  info.protectionClass = -3;
  info.thirdParty = true;
  const std::string named = "Identifier=str:com.example.app Key=str:k UUID=uuid:" + uuid.string();
  struct Row {
    Subcommand subcommand;
    const RequestOptions& options;
    std::string request;  // or "error: " and the message
  };
  const Row rows[] = {
      {Subcommand::Create, full,
       "Command=u64:0 ContainerClass=u64:2 CreateIfNecessary=bool:true "
       "Identifier=str:com.example.app Transient=bool:true UserID=u64:501"},
      {Subcommand::Create, noIdentifier,
       "Command=u64:0 ContainerClass=u64:2 CreateIfNecessary=bool:true Transient=bool:false "
       "UserID=u64:501"},
      {Subcommand::Lookup, full,
       "Command=u64:0 ContainerClass=u64:2 CreateIfNecessary=bool:false "
       "Identifier=str:com.example.app Transient=bool:true UserID=u64:501"},
      {Subcommand::List, full,
       "Command=u64:1 ContainerClass=u64:2 Transient=bool:true UserID=u64:501"},
      {Subcommand::Sweep, full, "Command=u64:4"},
      {Subcommand::SystemContainer, full, "Command=u64:15 Identifier=str:com.example.app"},
      {Subcommand::SystemContainer, noIdentifier, "Command=u64:15"},
      {Subcommand::CodeSigningInfo, full, "Command=u64:19 Identifier=str:com.example.app"},
      {Subcommand::InvalidateCodeSigning, full, "Command=u64:20"},
      {Subcommand::Create, noClass, "error: --class is required"},
      {Subcommand::Lookup, noUser, "error: --user is required"},
      {Subcommand::List, noClass, "error: --class is required"},
      {Subcommand::CodeSigningInfo, noClass, "error: --identifier is required"},
      {Subcommand::InfoGet, info,
       "Command=u64:6 ContainerClass=u64:2 " + named + " UserID=u64:501"},
      {Subcommand::InfoSet, info,
       "Command=u64:5 ContainerClass=u64:2 " + named + " UserID=u64:501 Value=i64:7"},
      {Subcommand::InfoRemove, info,
       "Command=u64:5 ContainerClass=u64:2 " + named + " UserID=u64:501"},
      {Subcommand::Metadata, info,
       "Command=u64:7 ContainerClass=u64:2 Identifier=str:com.example.app "
       "InfoDictRequested=bool:true UUID=uuid:" +
           uuid.string() + " UserID=u64:501"},
      {Subcommand::SetProtectionClass, info,
       "Command=u64:21 ContainerClass=u64:2 DataProtectionClass=i64:-3 "
       "Identifier=str:com.example.app IsThirdParty=bool:true RetryIfLocked=bool:false "
       "UserID=u64:501"},
      {Subcommand::Usage, info,
       "Command=u64:23 ContainerClass=u64:2 Identifier=str:com.example.app UUID=uuid:" +
           uuid.string() + " UserID=u64:501"},
      {Subcommand::InfoGet, full, "error: --uuid is required"},
      {Subcommand::SetProtectionClass, full, "error: --protection-class is required"},
  };
  for (const Row& row : rows) {
    const SubcommandInfo& info = subcommandInfo(row.subcommand);
    SCOPED_TRACE(std::string(info.name) + " " + row.request);
    platform::MessageDictionary request;
    std::string error;
    const bool built = buildRequest(info, row.options, &request, &error);
    EXPECT_EQ(built ? describe(request) : "error: " + error, row.request);
  }
}

// An operator's JSON argument can be of any depth; a deep one is refused with
// a message, never taken down with the stack.
TEST(KestrelctlRequestItemsTest, DeeplyNestedJsonIsRefused) {
  const auto nestedArrays = [](std::size_t levels) {
    return std::string(levels, '[') + std::string(levels, ']');
  };
  std::string error;
  EXPECT_TRUE(plistFromJson(nestedArrays(256), &error)) << error;
  for (std::size_t levels : {257, 200000}) {
    SCOPED_TRACE(levels);
    error.clear();
    EXPECT_FALSE(plistFromJson(nestedArrays(levels), &error));
    EXPECT_EQ(error, "nested deeper than 256 levels");
  }
}

}  // namespace
}  // namespace kestrel::kestrelctl
