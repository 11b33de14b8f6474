#include "codesigning/code_signing_mapping.h"

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "daemon/error_codes.h"
#include "store/global_configuration.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::infoWithEntitlements;
using testing::storedEntry;
using Strings = std::vector<std::string>;
using Entry = KSTCodeSigningEntry;

class CodeSigningMappingTest : public testing::StoreTest {
 protected:
  static std::string mappingPath() {
    return KSTGlobalConfiguration::sharedInstance().libraryDirectory().path() + "/" +
           kKSTCodeSigningMappingFileName;
  }
  static KSTErrorRef store(KSTCodeSigningMapping& mapping, const std::string& identifier,
                           const Entry& entry) {
    return testing::storeEntries(mapping, {entry}, {identifier});
  }
  // A bundle container of the installer's user on disk, with the given info.
  static void makeBundle(KSTContainerClass containerClass, const std::string& identifier,
                         std::optional<PlistDictionary> info = std::nullopt) {
    testing::writeContainer(33, containerClass, identifier, false, std::nullopt, std::move(info));
  }
};

TEST_F(CodeSigningMappingTest, StoreStartsEmptyWritesOnlyChangesAndPersistsAcrossARestart) {
  KSTCodeSigningMapping first;
  ASSERT_TRUE(first.isAvailable());
  EXPECT_TRUE(
      fakes.logging->containsMessage("No code signing info file found.  We will create one now"));
  EXPECT_FALSE(fs::exists(mappingPath()));
  Entry app(infoWithEntitlements({{kKSTSystemContainerEntitlement, true}}), 2);
  app.setChildBundleIdentifiers(Strings{"com.example.app.plugin"});
  Entry plugin(infoWithEntitlements({}), 4);
  plugin.setRegisteredByCaller(true);
  ASSERT_EQ(
      testing::storeEntries(first, {app, plugin}, {"com.example.app", "com.example.app.plugin"}),
      nullptr);
  EXPECT_TRUE(fs::exists(mappingPath()));

  KSTCodeSigningMapping second;
  ASSERT_TRUE(second.isAvailable());
  EXPECT_EQ(storedEntry("com.example.app", second), app);
  EXPECT_EQ(storedEntry("com.example.app.plugin", second), plugin);
  EXPECT_TRUE(second.identifierHasSystemContainer("com.example.app"));
  EXPECT_TRUE(second.identifierHasCallerRegisteredEntitlements("com.example.app.plugin"));

  // The same value, and an entry without information for an unknown id: no write.
  ASSERT_TRUE(fs::remove(mappingPath()));
  EXPECT_EQ(store(second, "com.example.app.plugin", plugin), nullptr);
  EXPECT_EQ(store(second, "com.example.other", Entry()), nullptr);
  EXPECT_FALSE(fs::exists(mappingPath()));
  // An entry without information removes a stored one.
  EXPECT_EQ(store(second, "com.example.app", Entry()), nullptr);
  EXPECT_TRUE(fs::exists(mappingPath()));
  EXPECT_FALSE(second.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_TRUE(testing::isError(testing::storeEntries(second, {app}, {"a", "b"}),
                               kKSTErrorMappingInvalidInput,
                               "Can't act on an invalid input: values count: 1, IDs count: 2"));
  EXPECT_TRUE(fakes.logged("Can't act on an invalid input: values count: 1, IDs count: 2",
                           testing::Match::Contains, "_setCodeSigningDictionaryValues"));
}

TEST_F(CodeSigningMappingTest, AFailedSaveKeepsTheChangeAndAnUnreadableFileTheStore) {
  KSTCodeSigningMapping mapping;
  fs::create_directories(mappingPath());  // a directory in the file's place
  KSTErrorRef error = store(mapping, "com.example.app", Entry(infoWithEntitlements({}), 2));
  ASSERT_TRUE(testing::isError(error, kKSTErrorMappingWriteFailed));
  EXPECT_TRUE(fakes.logged("Failed to write entitlement mapping file at " + mappingPath(),
                           testing::Match::Contains, "_writeCodeSigningMappingToDisk"));
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Error writing code signing mappings to disk after set : " + error->description()));
  EXPECT_TRUE(mapping.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_EQ(mapping.invalidateCodeSigningInfoForAppsWithoutBundleContainer(),
            kKSTErrorMappingWriteFailed);

  // A file that cannot be read makes the store unavailable, and is never overwritten.
  const std::string garbage = "this is not a property list";
  fs::remove(mappingPath());
  std::ofstream(mappingPath()) << garbage;
  KSTCodeSigningMapping unreadable;
  EXPECT_FALSE(unreadable.isAvailable());
  EXPECT_TRUE(
      fakes.logging->containsMessage("Unable to read mapping file from disk.  This is bad"));
  EXPECT_FALSE(unreadable.getCodeSigningInfoForIdentifier("com.example.app").has_value());
  EXPECT_EQ(unreadable.invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 0u);
  EXPECT_FALSE(
      unreadable.invalidateCodeSigningInfoForIdentifierAndItsChildren("com.example.app", nullptr));
  unreadable.removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.app");
  std::ifstream in(mappingPath());
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), garbage);
}

TEST_F(CodeSigningMappingTest, GroupEntitlementsAreParsedFromStringsAndArraysOfStrings) {
  const std::string ignoring =
      "Entitlement com.zorvane.security.application-groups for com.example.app ";
  const std::tuple<std::optional<PlistValue>, std::optional<Strings>, std::string> rows[] = {
      {"group.a", Strings{"group.a"}, ""},
      {PlistArray{"group.a", "group.a", "group.b"}, Strings{"group.a", "group.b"}, ""},
      {PlistArray{"group.a", 7}, std::nullopt, ignoring + "contains non-string values; ignoring."},
      {7, std::nullopt, ignoring + "does not contain supported types; ignoring."},
  };
  for (const auto& [value, expected, log] : rows) {
    SCOPED_TRACE(log);
    PlistDictionary entitlements;
    if (value) entitlements[kKSTApplicationGroupsEntitlement] = *value;
    auto groups = KSTCodeSigningMappingState::_copyApplicationGroupEntitlementForIdentifier(
        "com.example.app", entitlements, kKSTApplicationGroupsEntitlement);
    if (groups) std::sort(groups->begin(), groups->end());
    EXPECT_EQ(groups, expected);
    EXPECT_TRUE(log.empty() || fakes.logging->containsMessage(log));
  }
}

TEST_F(CodeSigningMappingTest, SystemGroupsNeedThePrefixAndFallBackToTheContainersKey) {
  KSTCodeSigningMapping mapping;
  const struct {
    const char* identifier;
    PlistDictionary entitlements;
    std::optional<Strings> expected;
  } rows[] = {
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
  for (const auto& row : rows) {
    ASSERT_EQ(store(mapping, row.identifier, Entry(infoWithEntitlements(row.entitlements), 2)),
              nullptr);
  }
  for (const auto& row : rows) {
    EXPECT_EQ(mapping.systemGroupIdentifiersForIdentifier(row.identifier), row.expected)
        << row.identifier;
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
  auto info = KSTCodeSigningMapping().getCodeSigningInfoForIdentifier("com.example.cached");
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(info->at("Other"), PlistValue(1));
  EXPECT_EQ(info->at(kKSTEntitlementsKey), cached.at("Entitlements"));
}

TEST_F(CodeSigningMappingTest, InvalidationAndRemovalReachTheChildren) {
  makeBundle(kKSTContainerClassBundleApplication, "com.example.app");
  makeBundle(kKSTContainerClassBundleVPNPlugin, "com.example.vpn");
  KSTCodeSigningMapping mapping;
  const PlistDictionary info = infoWithEntitlements({});
  Entry parent(info, 2);
  parent.setChildBundleIdentifiers(Strings{"com.example.app.ext", "com.example.gone"});
  Entry byCaller(info, 0);
  byCaller.setRegisteredByCaller(true);
  ASSERT_EQ(testing::storeEntries(
                mapping, {parent, Entry(info, 4), Entry(info, 6), Entry(info, 2), byCaller},
                {"com.example.app", "com.example.app.ext", "com.example.vpn", "com.example.orphan",
                 "com.example.caller"}),
            nullptr);
  auto invalid = [&](const char* identifier) {
    auto entry = storedEntry(identifier, mapping);
    return entry && entry->invalid();
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
  connectThroughDispatcher();
  KSTCodeSigningMapping& shared = KSTCodeSigningMapping::sharedInstance();
  const PlistDictionary info =
      infoWithEntitlements({{kKSTApplicationGroupsEntitlement, "group.a"}});
  Entry placeholder(info, 2);
  placeholder.setPlaceholder(true);
  ASSERT_EQ(testing::storeEntries(shared, {Entry(info, 2), placeholder},
                                  {"com.example.app", "com.example.placeholder"}),
            nullptr);
  EXPECT_EQ(ask(testing::request({{"Command", 19u}, {"Identifier", "com.example.app"}})),
            kKSTSuccess);
  EXPECT_EQ(connection->lastReply()->plist("ReplyInfoDictionary"), PlistValue(info));
  for (const PlistDictionary& unknown :
       {PlistDictionary{{"Command", 19u}, {"Identifier", "com.example.placeholder"}},
        PlistDictionary{{"Command", 19u}}}) {
    EXPECT_EQ(ask(testing::request(unknown)), kKSTErrorNotFound);
    EXPECT_FALSE(connection->lastReply()->contains("ReplyInfoDictionary"));
  }
  // No bundle containers at all: command 20 invalidates both entries.
  EXPECT_EQ(ask(testing::request({{"Command", 20u}})), kKSTSuccess);
  EXPECT_EQ(ask(testing::request({{"Command", 19u}, {"Identifier", "com.example.app"}})),
            kKSTErrorNotFound);
  EXPECT_TRUE(shared.codeSigningInfoExistForIdentifier("com.example.app"));
  EXPECT_FALSE(connection->cancelled());
}

using CodeSigningMappingConcurrencyTest = CodeSigningMappingTest;

TEST_F(CodeSigningMappingConcurrencyTest, ParallelReadersAndWritersSeeAConsistentStore) {
  KSTCodeSigningMapping mapping;
  constexpr int kThreads = 4, kRounds = 40;
  std::atomic<int> inconsistent{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      const std::string identifier = "com.example.app" + std::to_string(t);
      for (int round = 0; round < kRounds; ++round) {
        const std::string group = "group." + std::to_string(round);
        store(mapping, identifier,
              Entry(infoWithEntitlements({{kKSTApplicationGroupsEntitlement, group}}), 2));
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
    EXPECT_EQ(restarted.appGroupIdentifiersForIdentifier("com.example.app" + std::to_string(t)),
              Strings{"group." + std::to_string(kRounds - 1)})
        << t;
  }
}

TEST(CodeSigningMappingConcurrencyDeathTest, HoppingFromTheQueueAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  testing::FakeServices fakes;
  KSTCodeSigningMapping mapping;
  // The child dies before its scratch root could go, so it removes the root first.
  EXPECT_DEATH(
      {
        fs::remove_all(fakes.scratch.path());
        mapping.withState(false, [&](KSTCodeSigningMappingState&) {
          return mapping.withState(false, [](KSTCodeSigningMappingState&) { return true; });
        });
      },
      "isCurrent");
}

}  // namespace
}  // namespace kestrel
