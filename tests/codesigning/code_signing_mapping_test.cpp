#include "codesigning/code_signing_mapping.h"

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "daemon/error_codes.h"
#include "daemon/request_dispatch.h"
#include "platform/uuid.h"
#include "store/global_configuration.h"
#include "store/metadata.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using Strings = std::vector<std::string>;

PlistDictionary infoWithEntitlements(PlistDictionary entitlements) {
  return PlistDictionary{{kKSTEntitlementsKey, std::move(entitlements)}, {"Opaque", "kept"}};
}

class CodeSigningMappingTest : public ::testing::Test {
 protected:
  std::string mappingPath() const {
    return KSTGlobalConfiguration::sharedInstance()
        .libraryDirectory()
        .appending(kKSTCodeSigningMappingFileName)
        .path();
  }
  bool mappingFileExists() const { return fs::exists(mappingPath()); }
  void writeMappingFile(const std::string& contents) const {
    std::ofstream(mappingPath()) << contents;
  }
  std::string readMappingFile() const {
    std::ifstream in(mappingPath());
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }

  static KSTErrorRef stage(KSTCodeSigningMapping& mapping, std::vector<KSTCodeSigningEntry> values,
                           Strings identifiers) {
    return mapping.withState(KSTErrorRef(), [&](KSTCodeSigningMappingState& state) {
      return state._setCodeSigningDictionaryValues(values, identifiers);
    });
  }
  static KSTErrorRef stage(KSTCodeSigningMapping& mapping, const std::string& identifier,
                           const KSTCodeSigningEntry& entry) {
    return stage(mapping, {entry}, {identifier});
  }

  // A bundle container of the installer's user on disk, with the given info.
  void makeBundle(KSTContainerClass containerClass, const std::string& identifier,
                  std::optional<PlistDictionary> info = std::nullopt) {
    auto directory = KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        33, containerClass, false);
    ASSERT_TRUE(directory.has_value());
    const KSTFileURL url = directory->appending(platform::Uuid::random().string(), true);
    fs::create_directories(url.path());
    auto record = KSTMetadata::initWithUserId(33, platform::Uuid::random(), containerClass,
                                              identifier, std::move(info), url);
    KSTErrorRef error;
    ASSERT_TRUE(record->writeMetadataToDiskWithError(&error)) << FormatArg(error).description();
  }

  testing::FakeServices fakes;
};

TEST_F(CodeSigningMappingTest, FirstStartIsEmptyAndTheStorePersistsAcrossARestart) {
  KSTCodeSigningMapping first;
  ASSERT_TRUE(first.isAvailable());
  EXPECT_TRUE(
      fakes.logging->containsMessage("No code signing info file found.  We will create one now"));
  EXPECT_FALSE(mappingFileExists());

  KSTCodeSigningEntry app(infoWithEntitlements({{kKSTSystemContainerEntitlement, true}}), 2);
  app.setChildBundleIdentifiers(Strings{"com.example.app.plugin"});
  KSTCodeSigningEntry plugin(infoWithEntitlements({}), 4);
  plugin.setRegisteredByCaller(true);
  ASSERT_EQ(stage(first, {app, plugin}, {"com.example.app", "com.example.app.plugin"}), nullptr);
  EXPECT_TRUE(mappingFileExists());

  KSTCodeSigningMapping second;
  ASSERT_TRUE(second.isAvailable());
  for (const auto& [identifier, expected] :
       {std::pair{"com.example.app", app}, std::pair{"com.example.app.plugin", plugin}}) {
    SCOPED_TRACE(identifier);
    const bool same = second.withState(false, [&](KSTCodeSigningMappingState& state) {
      const KSTCodeSigningEntry* entry = state.entryForIdentifier(identifier);
      return entry != nullptr && entry->isEqual(expected);
    });
    EXPECT_TRUE(same);
  }
  EXPECT_TRUE(second.identifierHasSystemContainer("com.example.app"));
  EXPECT_TRUE(second.identifierHasCallerRegisteredEntitlements("com.example.app.plugin"));
}

TEST_F(CodeSigningMappingTest, StagingWritesOnlyWhatChanged) {
  KSTCodeSigningMapping mapping;
  const KSTCodeSigningEntry entry(infoWithEntitlements({}), 2);
  ASSERT_EQ(stage(mapping, "com.example.app", entry), nullptr);
  ASSERT_TRUE(fs::remove(mappingPath()));

  // The same value, and an entry without information for an unknown id: no write.
  EXPECT_EQ(stage(mapping, "com.example.app", KSTCodeSigningEntry(infoWithEntitlements({}), 2)),
            nullptr);
  EXPECT_EQ(stage(mapping, "com.example.other", KSTCodeSigningEntry()), nullptr);
  EXPECT_FALSE(mappingFileExists());

  // An entry without information removes a stored one.
  EXPECT_EQ(stage(mapping, "com.example.app", KSTCodeSigningEntry()), nullptr);
  EXPECT_TRUE(mappingFileExists());
  EXPECT_FALSE(mapping.codeSigningInfoExistForIdentifier("com.example.app"));

  KSTErrorRef error = stage(mapping, {entry}, {"a", "b"});
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), kKSTErrorMappingInvalidInput);
  EXPECT_EQ(error->localizedDescription(),
            "Can't act on an invalid input: values count: 1, IDs count: 2");
}

TEST_F(CodeSigningMappingTest, AFailedSaveKeepsTheChangeInMemory) {
  KSTCodeSigningMapping mapping;
  fs::create_directories(mappingPath());  // a directory in the file's place
  KSTErrorRef error =
      stage(mapping, "com.example.app", KSTCodeSigningEntry(infoWithEntitlements({}), 2));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(error->code(), kKSTErrorMappingWriteFailed);
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Error writing code signing mappings to disk after set : " + error->description()));
  EXPECT_TRUE(mapping.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_EQ(mapping.invalidateCodeSigningInfoForAppsWithoutBundleContainer(),
            kKSTErrorMappingWriteFailed);
}

TEST_F(CodeSigningMappingTest, AnUnreadableMappingFileMakesTheStoreUnavailable) {
  const char* contents = "this is not a property list";
  writeMappingFile(contents);
  KSTCodeSigningMapping mapping;
  EXPECT_FALSE(mapping.isAvailable());
  EXPECT_TRUE(
      fakes.logging->containsMessage("Unable to read mapping file from disk.  This is bad"));
  EXPECT_FALSE(mapping.getCodeSigningInfoForIdentifier("com.example.app").has_value());
  EXPECT_EQ(mapping.invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 0u);
  EXPECT_FALSE(
      mapping.invalidateCodeSigningInfoForIdentifierAndItsChildren("com.example.app", nullptr));
  mapping.removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.app");
  EXPECT_EQ(readMappingFile(), contents);  // never overwritten
}

TEST_F(CodeSigningMappingTest, GroupEntitlementsAreParsedFromStringsAndArraysOfStrings) {
  struct Row {
    const char* label;
    std::optional<PlistValue> value;
    std::optional<Strings> expected;
    const char* log;
  };
  const Row rows[] = {
      {"single string", PlistValue("group.a"), Strings{"group.a"}, nullptr},
      {"duplicates", PlistValue(PlistArray{"group.a", "group.a", "group.b"}),
       Strings{"group.a", "group.b"}, nullptr},
      {"mixed array", PlistValue(PlistArray{"group.a", 7}), std::nullopt,
       "Entitlement com.zorvane.security.application-groups for com.example.app contains "
       "non-string values; ignoring."},
      {"number", PlistValue(7), std::nullopt,
       "Entitlement com.zorvane.security.application-groups for com.example.app does not contain "
       "supported types; "
       "ignoring."},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    PlistDictionary entitlements;
    if (row.value) entitlements[kKSTApplicationGroupsEntitlement] = *row.value;
    auto groups = KSTCodeSigningMappingState::_copyApplicationGroupEntitlementForIdentifier(
        "com.example.app", entitlements, kKSTApplicationGroupsEntitlement);
    if (groups) std::sort(groups->begin(), groups->end());
    EXPECT_EQ(groups, row.expected);
    if (row.log) {
      EXPECT_TRUE(fakes.logging->containsMessage(row.log));
    }
  }
}

TEST_F(CodeSigningMappingTest, SystemGroupsNeedThePrefixAndFallBackToTheContainersKey) {
  KSTCodeSigningMapping mapping;
  struct Row {
    const char* identifier;
    PlistDictionary entitlements;
    std::optional<Strings> expected;
  };
  const Row rows[] = {
      {"filtered",
       {{kKSTSystemGroupsEntitlement, PlistArray{"systemgroup.x", "foo"}}},
       Strings{"systemgroup.x"}},
      {"empty falls back",
       {{kKSTSystemGroupsEntitlement, PlistArray{}},
        {kKSTSystemGroupContainersEntitlement, "systemgroup.y"}},
       Strings{"systemgroup.y"}},
      {"primary wins",
       {{kKSTSystemGroupsEntitlement, "systemgroup.p"},
        {kKSTSystemGroupContainersEntitlement, "systemgroup.q"}},
       Strings{"systemgroup.p"}},
      {"neither", {}, std::nullopt},
  };
  for (const Row& row : rows) {
    ASSERT_EQ(stage(mapping, row.identifier,
                    KSTCodeSigningEntry(infoWithEntitlements(row.entitlements), 2)),
              nullptr);
  }
  for (const Row& row : rows) {
    SCOPED_TRACE(row.identifier);
    EXPECT_EQ(mapping.systemGroupIdentifiersForIdentifier(row.identifier), row.expected);
  }
  EXPECT_TRUE(
      fakes.logging->containsMessage("System group ID foo does not have proper prefix, ignoring."));

  // Iteration applies no prefix filter and takes the fallback key only when asked.
  std::map<std::string, std::optional<Strings>> seen;
  auto record = [&](const std::string& identifier, const KSTGroupIdentifiers& groups) {
    seen[identifier] = groups;
  };
  mapping.withState(false, [&](KSTCodeSigningMappingState& state) {
    state.iterateGroupIdsWithKey(kKSTSystemGroupsEntitlement,
                                 std::string_view(kKSTSystemGroupContainersEntitlement), record);
    return true;
  });
  EXPECT_EQ(seen["filtered"], (Strings{"systemgroup.x", "foo"}));
  EXPECT_EQ(seen["empty falls back"], Strings{"systemgroup.y"});
  seen.clear();
  mapping.iterateGroupIdsWithKey(kKSTSystemGroupsEntitlement, std::nullopt, record);
  EXPECT_EQ(seen["empty falls back"], Strings{});
}

TEST_F(CodeSigningMappingTest, CachedBundleInformationIsMigratedOnFirstQuery) {
  const PlistDictionary cached{
      {"Entitlements", PlistDictionary{{kKSTApplicationGroupsEntitlement, "group.a"}}},
      {"Other", 1}};
  makeBundle(kKSTContainerClassBundleApplication, "com.example.cached",
             PlistDictionary{{kKSTCachedCodeSigningInfoKey, cached}});
  makeBundle(kKSTContainerClassBundleApplication, "com.example.bare");
  KSTCodeSigningMapping mapping;
  EXPECT_EQ(mapping.appGroupIdentifiersForIdentifier("com.example.cached"), Strings{"group.a"});
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Migrating code signing info from bundle container upon request for com.example.cached"));
  EXPECT_EQ(mapping.dataContainerTypeForIdentifier("com.example.cached"), 2u);
  EXPECT_FALSE(mapping.codeSigningInfoExistForIdentifier("com.example.bare"));

  KSTCodeSigningMapping restarted;
  auto info = restarted.getCodeSigningInfoForIdentifier("com.example.cached");
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(info->at("Other"), PlistValue(1));
  EXPECT_EQ(info->at(kKSTEntitlementsKey), cached.at("Entitlements"));
}

TEST_F(CodeSigningMappingTest, InvalidationAndRemovalReachTheChildren) {
  makeBundle(kKSTContainerClassBundleApplication, "com.example.app");
  makeBundle(kKSTContainerClassBundleVPNPlugin, "com.example.vpn");
  KSTCodeSigningMapping mapping;
  const PlistDictionary info = infoWithEntitlements({});
  KSTCodeSigningEntry parent(info, 2);
  parent.setChildBundleIdentifiers(Strings{"com.example.app.ext", "com.example.gone"});
  KSTCodeSigningEntry byCaller(info, 0);
  byCaller.setRegisteredByCaller(true);
  ASSERT_EQ(stage(mapping,
                  {parent, KSTCodeSigningEntry(info, 4), KSTCodeSigningEntry(info, 6),
                   KSTCodeSigningEntry(info, 2), byCaller},
                  {"com.example.app", "com.example.app.ext", "com.example.vpn",
                   "com.example.orphan", "com.example.caller"}),
            nullptr);

  auto invalid = [&](const char* identifier) {
    return mapping.withState(false, [&](KSTCodeSigningMappingState& state) {
      const KSTCodeSigningEntry* entry = state.entryForIdentifier(identifier);
      return entry != nullptr && entry->invalid();
    });
  };
  EXPECT_EQ(mapping.invalidateCodeSigningInfoForAppsWithoutBundleContainer(), kKSTSuccess);
  for (const auto& [identifier, expected] :
       std::map<std::string, bool>{{"com.example.app", false},
                                   {"com.example.vpn", false},
                                   {"com.example.caller", false},
                                   {"com.example.orphan", true},
                                   {"com.example.app.ext", true}}) {  // no bundle container
    EXPECT_EQ(invalid(identifier.c_str()), expected) << identifier;
  }

  KSTErrorRef error;
  EXPECT_TRUE(
      mapping.invalidateCodeSigningInfoForIdentifierAndItsChildren("com.example.app", &error));
  EXPECT_TRUE(invalid("com.example.app"));
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Invalidating code signing info for com.example.app child: com.example.app.ext"));

  mapping.removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.app");
  EXPECT_FALSE(mapping.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_FALSE(mapping.codeSigningInfoExistForIdentifier("com.example.app.ext"));
  EXPECT_TRUE(mapping.codeSigningInfoExistForIdentifier("com.example.vpn"));
  EXPECT_FALSE(KSTCodeSigningMapping().codeSigningInfoExistForIdentifier("com.example.app.ext"));
}

TEST_F(CodeSigningMappingTest, CommandsNineteenAndTwentyAnswerThroughTheDispatcher) {
  ASSERT_TRUE(KSTStartRequestListener(platform::DispatchQueue::createConcurrent("test.listener")));
  auto connection = fakes.connectAllowedClient();

  KSTCodeSigningMapping& shared = KSTCodeSigningMapping::sharedInstance();
  const PlistDictionary info =
      infoWithEntitlements({{kKSTApplicationGroupsEntitlement, "group.a"}});
  KSTCodeSigningEntry placeholder(info, 2);
  placeholder.setPlaceholder(true);
  ASSERT_EQ(stage(shared, {KSTCodeSigningEntry(info, 2), placeholder},
                  {"com.example.app", "com.example.placeholder"}),
            nullptr);

  auto ask = [&](std::uint64_t command, std::optional<std::string> identifier) {
    platform::MessageDictionary message;
    message.setUint64("Command", command);
    if (identifier) message.setString("Identifier", *identifier);
    EXPECT_TRUE(connection->deliver(message));
    return connection->lastReply().value_or(platform::MessageDictionary{});
  };
  auto reply = ask(19, "com.example.app");
  EXPECT_EQ(reply.uint64("ReplyError"), kKSTSuccess);
  EXPECT_EQ(reply.plist("ReplyInfoDictionary"), PlistValue(info));
  for (const auto& identifier :
       {std::optional<std::string>("com.example.placeholder"), std::optional<std::string>()}) {
    reply = ask(19, identifier);
    EXPECT_EQ(reply.uint64("ReplyError"), kKSTErrorNotFound);
    EXPECT_FALSE(reply.contains("ReplyInfoDictionary"));
  }

  // No bundle containers at all: command 20 invalidates both entries.
  reply = ask(20, std::nullopt);
  EXPECT_EQ(reply.uint64("ReplyError"), kKSTSuccess);
  EXPECT_EQ(ask(19, "com.example.app").uint64("ReplyError"), kKSTErrorNotFound);
  EXPECT_TRUE(shared.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_FALSE(connection->cancelled());
}

TEST(CodeSigningMappingConcurrencyTest, ParallelReadersAndWritersSeeAConsistentStore) {
  testing::FakeServices fakes;
  KSTCodeSigningMapping mapping;
  constexpr int kThreads = 4;
  constexpr int kRounds = 40;
  std::atomic<int> inconsistent{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      const std::string identifier = "com.example.app" + std::to_string(t);
      for (int round = 0; round < kRounds; ++round) {
        const std::string group = "group." + std::to_string(round);
        KSTCodeSigningEntry entry(infoWithEntitlements({{kKSTApplicationGroupsEntitlement, group}}),
                                  2);
        mapping.withState(KSTErrorRef(), [&](KSTCodeSigningMappingState& state) {
          return state._setCodeSigningDictionaryValues({entry}, {identifier});
        });
        if (mapping.appGroupIdentifiersForIdentifier(identifier) != Strings{group}) ++inconsistent;
        mapping.invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, nullptr);
        (void)mapping.getCodeSigningInfoForIdentifier(identifier);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(inconsistent.load(), 0);
  KSTCodeSigningMapping restarted;
  for (int t = 0; t < kThreads; ++t) {
    SCOPED_TRACE(t);
    EXPECT_EQ(restarted.appGroupIdentifiersForIdentifier("com.example.app" + std::to_string(t)),
              Strings{"group." + std::to_string(kRounds - 1)});
  }
}

TEST(CodeSigningMappingConcurrencyDeathTest, HoppingFromTheQueueAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  testing::FakeServices fakes;
  KSTCodeSigningMapping mapping;
  EXPECT_DEATH(mapping.withState(false,
                                 [&](KSTCodeSigningMappingState&) {
                                   return mapping.withState(
                                       false, [](KSTCodeSigningMappingState&) { return true; });
                                 }),
               "isCurrent");
}

}  // namespace
}  // namespace kestrel
