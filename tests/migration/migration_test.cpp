// Stores laid out by older releases, built on a scratch root, brought up to
// date: what the first start after boot moves and restores, what command 24
// fixes and takes over. Each migration is run twice: the second run must
// change nothing, with its marker and without it.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "codesigning/system_container_acls.h"
#include "migration/container_migrator.h"
#include "platform/file_system.h"
#include "platform/uuid.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "store/plist_io.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::namesIn;
using Strings = std::vector<std::string>;

class MigrationTest : public testing::StoreTest {
 protected:
  KSTClientConnection& shared = KSTClientConnection::sharedClientConnection();
  KSTContainerMigrator& migrator = KSTContainerMigrator::sharedInstance();

  static std::string library() {
    return KSTGlobalConfiguration::sharedInstance().libraryDirectory().path();
  }
  static std::optional<PlistDictionary> plistAt(const std::string& path) {
    return KST_dictionaryWithContentsOfURL(KSTFileURL(path), kKSTPropertyListImmutable, nullptr);
  }
  static std::string readAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  static void removeMarkers() {
    for (const char* marker : {kKSTBundleMigrationMarker, kKSTACLMigrationMarker,
                               kKSTGroupIdMigrationMarker, kKSTCodeSigningMigrationMarker}) {
      fs::remove(library() + "/" + marker);
    }
  }
};

TEST_F(MigrationTest, FirstStartAfterBootMovesWhatOlderReleasesLeftInOldPlaces) {
  fakes.deviceInfo->setBuildVersion("23A100");
  const std::string oldHome = fakes.scratch.resolve("/private/var/mobile/Library");
  fakes.scratch.writeFile("/private/var/mobile/Library/Kestrel/old-state.plist", "x");
  fakes.scratch.writeFile("/private/var/mobile/Library/Logs/Kestrel/kestreld.log.1", "old log");
  const std::string bundleUUID = platform::Uuid::random().string();
  fakes.scratch.writeFile(
      "/private/var/mobile/Containers/Bundle/Application/" + bundleUUID + "/app.bin", "x");
  // A well-known system container that an older release put under a UUID.
  const KSTMetadataRef wellKnown = testing::writeContainer(499, 12, "com.zorvane.egretd");
  const KSTMetadataRef other = testing::writeContainer(499, 12, "com.example.not-well-known");
  const std::string systemDirectory = testing::classDirectory(499, 12);
  const std::string fixedPlace = systemDirectory + "/com.zorvane.egretd";

  for (int run = 1; run <= 2; ++run) {
    SCOPED_TRACE(run);
    shared.rebootContainerManagerSetup();
    EXPECT_FALSE(fs::exists(oldHome + "/Kestrel"));
    EXPECT_FALSE(fs::exists(oldHome + "/Logs/Kestrel"));
    const std::string logs = KSTGlobalConfiguration::sharedInstance().logDirectory().path();
    EXPECT_EQ(readAll(logs + "/kestreld.log.1"), "old log");
    EXPECT_FALSE(fs::exists(fakes.scratch.resolve("/private/var/mobile/Containers/Bundle")));
    EXPECT_TRUE(fs::exists(KSTGlobalConfiguration::sharedInstance().bundleDirectory().path() +
                           "/Application/" + bundleUUID + "/app.bin"));
    const KSTMetadataRef moved = testing::existingContainer(499, 12, "com.zorvane.egretd");
    ASSERT_NE(moved, nullptr);
    EXPECT_EQ(moved->url().path(), fixedPlace);
    EXPECT_TRUE(fs::exists(fixedPlace + "/.com.zorvane.kestrel.metadata.plist"));
    EXPECT_EQ(namesIn(systemDirectory),
              (Strings{other->url().lastPathComponent(), "com.zorvane.egretd"}));
  }
  EXPECT_EQ(fakes.countLogged("Migrating well-known container com.zorvane.egretd",
                              testing::Match::Prefix),
            1u);
  EXPECT_EQ(fakes.countLogged("Migrated log files on 23A100"), 1u);
  EXPECT_FALSE(fakes.logged("Failed", testing::Match::Contains));

  // A multi-user host keeps the old directories of user 501.
  fakes.keyBag->setUserTypeInfo(platform::UserTypeInfo{platform::DeviceMode::MultiUser});
  fakes.scratch.writeFile("/private/var/mobile/Library/Kestrel/old-state.plist", "x");
  shared.rebootContainerManagerSetup();
  EXPECT_TRUE(fs::exists(oldHome + "/Kestrel/old-state.plist"));
}

TEST_F(MigrationTest, BackupOfSystemContainersIsRestoredIntoLiveContainers) {
  const std::string backup = "/private/var/mobile/Library/Backup/SystemContainers";
  for (const bool internal : {false, true}) {
    SCOPED_TRACE(internal ? "internal build" : "customer build");
    fakes.deviceInfo->setInternalBuild(internal);
    const KSTMetadataRef live = make(499, 12, "com.zorvane.egretd");
    fs::create_directories(live->url().path() + "/Library/Preferences");
    std::ofstream(live->url().path() + "/Library/Preferences/live.plist") << "live";
    fakes.scratch.writeFile(backup + "/Data/com.zorvane.egretd/Library/restored.plist", "r");
    ASSERT_EQ(
        ::chown(fakes.scratch.resolve(backup + "/Data/com.zorvane.egretd/Library/restored.plist")
                    .c_str(),
                501, 501),
        0);
    fakes.scratch.writeFile(backup + "/Data/com.zorvane.egretd/.hidden", "h");
    fakes.scratch.writeFile(backup + "/Shared/systemgroup.com.zorvane.heron.tiles/tile", "t");

    shared.rebootContainerManagerSetup();
    // The restored "Library" replaced the live one, and got the default
    // sub-directories it lacked back; the live metadata stays.
    const std::string system = live->url().path();
    EXPECT_EQ(namesIn(system + "/Library"), (Strings{"Caches", "Preferences", "restored.plist"}));
    // The user who wrote the backup owns nothing in a system container.
    EXPECT_EQ(testing::ownerOf(system + "/Library/restored.plist"), kKSTSystemContainerItemOwner);
    EXPECT_FALSE(fs::exists(system + "/.hidden"));
    EXPECT_TRUE(fs::exists(system + "/.com.zorvane.kestrel.metadata.plist"));
    const KSTMetadataRef group =
        testing::existingContainer(499, 13, "systemgroup.com.zorvane.heron.tiles");
    ASSERT_NE(group, nullptr);
    EXPECT_EQ(readAll(group->url().path() + "/tile"), "t");
    // Only an internal build keeps the backup, now under its work name.
    EXPECT_EQ(fakes.scratch.exists(backup), internal);
    EXPECT_EQ(namesIn(fakes.scratch.resolve(backup)),
              (internal ? Strings{"Data.inprogress", "Shared.inprogress"} : Strings{}));
    fs::remove_all(fakes.scratch.resolve(backup));
  }
  EXPECT_FALSE(fakes.logged("Failed", testing::Match::Contains));

  // An entry that cannot be put in place is kept aside, under its container's identifier
  // (still an internal build, so the backup stays to be looked at).
  const KSTMetadataRef locked = make(499, 12, "com.zorvane.ternd");
  fakes.scratch.writeFile(backup + "/Data/com.zorvane.ternd/blocked", "b");
  ASSERT_EQ(platform::lchflags(locked->url().path().c_str(), platform::kFileFlagUserImmutable), 0);
  shared.rebootContainerManagerSetup();
  ASSERT_EQ(platform::lchflags(locked->url().path().c_str(), 0), 0);
  EXPECT_FALSE(fs::exists(locked->url().path() + "/blocked"));
  EXPECT_EQ(
      readAll(fakes.scratch.resolve(backup + "/Data.inprogress.failed/com.zorvane.ternd/blocked")),
      "b");
}

TEST_F(MigrationTest, DataMigrationFixesBundleOwnersAndSystemContainerACLsOnce) {
  const KSTMetadataRef bundle = make(33, 1, "com.example.app");
  const std::string binary = bundle->url().path() + "/app.bin";
  std::ofstream(binary) << "x";
  ASSERT_EQ(::chown(binary.c_str(), 0, 0), 0);
  const KSTMetadataRef system = make(499, 12, "com.example.daemon");
  const std::string settings = system->url().path() + "/Library/settings";
  std::ofstream(settings) << "x";
  ASSERT_EQ(::chown(settings.c_str(), 0, 0), 0);

  KSTErrorRef error;
  ASSERT_TRUE(migrator.performDataMigratorMigrationWithError(&error)) << testing::messageOf(error);
  EXPECT_EQ(testing::ownerOf(binary), 33u);
  EXPECT_EQ(testing::ownerOf(settings), kKSTSystemContainerItemOwner);
  for (const char* marker : {kKSTBundleMigrationMarker, kKSTACLMigrationMarker}) {
    SCOPED_TRACE(marker);
    const auto content = plistAt(library() + "/" + marker);
    ASSERT_TRUE(content.has_value());
    EXPECT_TRUE(content->contains(kKSTMigrationVersionNumberKey));
    EXPECT_TRUE(content->contains(kKSTMigrationTimeKey));
  }

  // With the markers, nothing is touched again; without them, the work is redone.
  ASSERT_EQ(::chown(binary.c_str(), 0, 0), 0);
  ASSERT_EQ(::chown(settings.c_str(), 0, 0), 0);
  ASSERT_TRUE(migrator.performDataMigratorMigrationWithError(&error));
  EXPECT_EQ(testing::ownerOf(binary), 0u);
  EXPECT_EQ(testing::ownerOf(settings), 0u);
  removeMarkers();
  ASSERT_TRUE(migrator.performDataMigratorMigrationWithError(&error));
  EXPECT_EQ(testing::ownerOf(binary), 33u);
  EXPECT_EQ(testing::ownerOf(settings), kKSTSystemContainerItemOwner);
}

TEST_F(MigrationTest, OlderCodeSigningDataIsTakenOverAndUnnamedGroupsRemoved) {
  KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
  KSTCodeSigningEntry invalidated(testing::infoWithEntitlements({}), 2);
  invalidated.setInvalid(true);
  ASSERT_EQ(testing::storeEntries(
                mapping, {KSTCodeSigningEntry(testing::infoWithEntitlements({}), 2), invalidated},
                {"com.example.known", "com.example.invalidated"}),
            nullptr);
  // Application groups in data containers' info.
  const PlistDictionary groupsA{{kKSTGroupContainerIDsKey, PlistArray{"group.a"}}};
  const KSTMetadataRef grouped =
      testing::writeContainer(501, 4, "com.example.grouped", false, std::nullopt, groupsA);
  const KSTMetadataRef known =
      testing::writeContainer(501, 2, "com.example.known", false, std::nullopt, groupsA);
  // The legacy file.
  const PlistDictionary legacy{
      {"com.example.legacy", PlistDictionary{{kKSTApplicationGroupsEntitlement, "group.b"}}},
      {"com.example.by-caller", PlistDictionary{{"com.example.e", true}}},
      {"com.example.known", PlistDictionary{{"com.example.e", true}}},
      {"com.example.invalidated", PlistDictionary{{"com.example.e", true}}},
      {kKSTLegacyChildPluginBundleIDsKey,
       PlistDictionary{{"com.example.legacy", PlistArray{"com.example.legacy.plugin"}}}},
      {kKSTLegacyEntitlementsRegisteredByCallerKey,
       PlistDictionary{{"com.example.by-caller", true}, {"com.example.legacy", false}}},
      {kKSTLegacyPlaceholderEntitlementsKey, PlistDictionary{{"com.example.legacy", 1}}},
  };
  const std::string legacyFile = library() + "/kst_entitlements.plist";
  ASSERT_TRUE(
      KST_writeToURL(legacy, KSTFileURL(legacyFile), kKSTDaemonFileWritingOptions, nullptr));
  // The installer's cached information in bundle containers.
  const PlistDictionary cached{
      {kKSTCachedCodeSigningInfoKey,
       PlistDictionary{{"Entitlements",
                        PlistDictionary{{kKSTApplicationGroupsEntitlement, PlistArray{"group.c"}}}},
                       {"Opaque", "kept"}}}};
  const KSTMetadataRef app =
      testing::writeContainer(33, 1, "com.example.app", false, std::nullopt, cached);
  const KSTMetadataRef framework =
      testing::writeContainer(33, 8, "com.example.framework", false, std::nullopt, cached);
  for (const char* group : {"group.a", "group.b", "group.c", "group.orphan"}) make(501, 7, group);

  mapping.performAllCodeSigningMigrationAndReconciliation();

  struct Row {
    const char* identifier;
    bool invalid, placeholder, registeredByCaller;
    KSTContainerClass dataClass;
  } rows[] = {
      {"com.example.grouped", true, false, false, 4},
      {"com.example.known", false, false, false, 2},  // kept as it was
      {"com.example.invalidated", true, false, false, 0},
      {"com.example.legacy", true, true, false, 0},
      {"com.example.by-caller", false, false, true, 0},
      {"com.example.app", false, false, false, 2},
      {"com.example.framework", false, false, false, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.identifier);
    const auto entry = testing::storedEntry(row.identifier);
    ASSERT_TRUE(entry.has_value());
    EXPECT_EQ(entry->invalid(), row.invalid);
    EXPECT_EQ(entry->placeholder(), row.placeholder);
    EXPECT_EQ(entry->registeredByCaller(), row.registeredByCaller);
    EXPECT_EQ(entry->dataContainerClass(), row.dataClass);
  }
  EXPECT_EQ(testing::storedEntry("com.example.known")->codeSigningInfo(),
            testing::infoWithEntitlements({}));
  EXPECT_EQ(testing::storedEntry("com.example.legacy")->childBundleIdentifiers(),
            Strings{"com.example.legacy.plugin"});
  EXPECT_EQ(mapping.appGroupIdentifiersForIdentifier("com.example.grouped"), Strings{"group.a"});
  EXPECT_EQ(mapping.appGroupIdentifiersForIdentifier("com.example.app"), Strings{"group.c"});
  EXPECT_EQ(testing::storedEntry("com.example.app")->codeSigningInfo()->at("Opaque"),
            PlistValue("kept"));

  // The old copies are gone, on disk.
  EXPECT_FALSE(fs::exists(legacyFile));
  for (const KSTMetadataRef& container : {grouped, known, app, framework}) {
    SCOPED_TRACE(container->identifier());
    const auto info = testing::infoOnDisk(container);
    EXPECT_FALSE(info && (info->contains(kKSTGroupContainerIDsKey) ||
                          info->contains(kKSTCachedCodeSigningInfoKey)));
  }
  EXPECT_TRUE(fs::exists(library() + "/" + kKSTGroupIdMigrationMarker));
  EXPECT_TRUE(fs::exists(library() + "/" + kKSTCodeSigningMigrationMarker));
  // Reconciliation: the group nobody names is staged for deletion.
  for (const char* group : {"group.a", "group.b", "group.c"}) {
    EXPECT_NE(testing::existingContainer(501, 7, group), nullptr) << group;
  }
  EXPECT_EQ(testing::existingContainer(501, 7, "group.orphan"), nullptr);

  // Again, with the markers and without them: the store stays as it is.
  const std::string mappingFile = mapping.withState(
      std::string(),
      [](KSTCodeSigningMappingState& state) { return state.mappingFileURL().path(); });
  const std::string before = readAll(mappingFile);
  mapping.performAllCodeSigningMigrationAndReconciliation();
  removeMarkers();
  mapping.performAllCodeSigningMigrationAndReconciliation();
  EXPECT_EQ(readAll(mappingFile), before);
  EXPECT_EQ(fakes.countLogged("Migrating", testing::Match::Prefix), 6u);
}

}  // namespace
}  // namespace kestrel
