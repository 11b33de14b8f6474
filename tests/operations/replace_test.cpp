// Replace and its journal: refusals leave everything as it was, a swap ends
// whole, one that stops half-way is rolled back, and recovery at start-up
// finishes or undoes whatever a journal left behind.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "codesigning/code_signing_mapping.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "platform/file_system.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "store/plist_io.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::namesIn;
using Strings = std::vector<std::string>;
using platform::Uuid;

constexpr const char* kApp = "com.example.app";

class ReplaceTest : public testing::StoreTest {
 protected:
  static std::string replaceDirectory() {
    return KSTGlobalConfiguration::sharedInstance().replaceDirectory().path();
  }
  // The live container of the identifier, as a lookup finds it now.
  static KSTMetadataRef live(const std::string& identifier, KSTContainerClass c = 2,
                             std::uint32_t user = 501) {
    return testing::existingContainer(user, c, identifier);
  }
  std::uint64_t replace(const KSTMetadataRef& old, const KSTMetadataRef& fresh,
                        bool preserve = false, bool sweep = false) {
    std::uint64_t code = kKSTSuccess;
    installer.replaceContainer(
        old ? std::optional(old->uuid()) : std::nullopt, fresh->uuid(), old ? old->uid() : 0,
        fresh->uid(), old ? std::optional(old->identifier()) : std::nullopt, fresh->identifier(),
        old ? old->containerClass() : 0, fresh->containerClass(), preserve, sweep, &code);
    return code;
  }
  // Writes a journal as a replace would, and gives its path.
  std::string journal(const std::string& old, const std::string& fresh, const std::string& parked,
                      const std::string& destination) {
    const std::string path = replaceDirectory() + "/" + Uuid::random().string() + ".plist";
    KSTErrorRef error;
    EXPECT_TRUE(installer._writeToDiskReplaceAt(KSTFileURL(path), KSTFileURL(old, true),
                                                KSTFileURL(fresh, true), KSTFileURL(parked, true),
                                                KSTFileURL(destination, true), &error))
        << testing::messageOf(error);
    return path;
  }
};

TEST_F(ReplaceTest, RefusalsLeaveDiskAndCacheAsTheyWere) {
  const KSTMetadataRef old = make(501, 2, kApp);
  const KSTMetadataRef fresh = make(501, 2, kApp, true);
  const KSTMetadataRef other = make(501, 2, "com.example.other");
  const KSTMetadataRef system = make(499, 12, "com.zorvane.egretd");  // not named by a UUID
  const KSTMetadataRef otherUser = make(502, 2, kApp, true);
  const KSTMetadataRef group = make(501, 7, "group.com.example", true);
  const Uuid unknown = Uuid::random();
  // Something already where the new one would go.
  const std::string occupied =
      testing::classDirectory(501, 2) + "/" + fs::path(other->url().path()).filename().string();
  // Old and new as the request names them: a container's UUID, user, class
  // and identifier; a missing old one names none.
  struct Side {
    std::optional<Uuid> uuid;
    std::uint32_t user;
    KSTContainerClass containerClass;
    std::optional<std::string> identifier;
  };
  const auto side = [](const KSTMetadataRef& c) {
    return Side{c->uuid(), c->uid(), c->containerClass(), c->identifier()};
  };
  const Side none{std::nullopt, 0, 0, std::nullopt};
  struct Row {
    const char* label;
    Side old, fresh;
    bool preserve;
    std::uint64_t code;
  } rows[] = {
      {"no new UUID", side(old), {std::nullopt, 501, 2, kApp}, false, kKSTErrorInvalidObject},
      {"old class 0", {old->uuid(), 501, 0, kApp}, side(fresh), false, kKSTErrorInvalidObject},
      {"preserving without an old UUID", none, side(fresh), true, kKSTErrorInvalidObject},
      {"classes differ", side(old), side(group), false, kKSTErrorClassMismatch},
      {"users differ", side(old), side(otherUser), false, kKSTErrorUserMismatch},
      {"old not cached", {unknown, 501, 2, kApp}, side(fresh), false, kKSTErrorNotFound},
      {"same container", side(old), side(old), false, kKSTErrorReplaceSameContainer},
      {"directory name not a UUID", none, side(system), false, kKSTErrorInvalidURL},
      {"a live container of the identifier, without old", none, side(fresh), false,
       kKSTErrorAlreadyExists},
      {"destination occupied", side(old), side(other), false, kKSTErrorAlreadyExists},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    std::uint64_t code = kKSTSuccess;
    installer.replaceContainer(row.old.uuid, row.fresh.uuid, row.old.user, row.fresh.user,
                               row.old.identifier, row.fresh.identifier, row.old.containerClass,
                               row.fresh.containerClass, row.preserve, false, &code);
    EXPECT_EQ(code, row.code);
    for (const KSTMetadataRef& c : {old, fresh, other}) {
      EXPECT_TRUE(fs::is_directory(c->url().path())) << c->url().path();
    }
    EXPECT_EQ(live(kApp), old);
    EXPECT_TRUE(namesIn(replaceDirectory()).empty());
    EXPECT_TRUE(namesIn(testing::stagingDirectory()).empty());
  }
  EXPECT_TRUE(fakes.logged("Container already exists at " + occupied));
}

TEST_F(ReplaceTest, NewTakesTheOldPlaceAndTheOldGoesToDeathRowWithItsJournal) {
  // Without an old container: straight to the class directory, no journal, no sweep.
  const KSTMetadataRef first = make(501, 2, "com.example.first", true);
  const std::string name = fs::path(first->url().path()).filename();
  ASSERT_EQ(replace(nullptr, first), kKSTSuccess);
  EXPECT_EQ(first->url().path(), testing::classDirectory(501, 2) + "/" + name);
  EXPECT_EQ(live("com.example.first"), first);
  EXPECT_TRUE(namesIn(testing::deathRowDirectory()).empty());

  const KSTMetadataRef old = make(501, 2, kApp);
  std::ofstream(old->url().path() + "/Documents/old") << "old";
  const KSTMetadataRef fresh = make(501, 2, kApp, true);
  const std::string oldPath = old->url().path();
  ASSERT_EQ(replace(old, fresh), kKSTSuccess);
  EXPECT_FALSE(fs::exists(oldPath));
  EXPECT_EQ(live(kApp), fresh);
  EXPECT_EQ(fs::path(fresh->url().path()).parent_path(), testing::classDirectory(501, 2));
  EXPECT_FALSE(fresh->transient());
  EXPECT_TRUE(namesIn(replaceDirectory()).empty());
  EXPECT_TRUE(namesIn(testing::stagingDirectory()).empty());
  // Parked old container and journal both wait in death row; no sweep was asked for.
  KSTDeathRowQueue()->sync([] {});
  EXPECT_EQ(namesIn(testing::deathRowDirectory()).size(), 2u);
  EXPECT_EQ(fakes.keepAlive->totalBegins(), 0u);
}

TEST_F(ReplaceTest, BundleReplaceInvalidatesTheOldIdentifiersCodeSigningEntries) {
  KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
  const KSTCodeSigningEntry entry(testing::infoWithEntitlements({}), 1);
  ASSERT_EQ(testing::storeEntries(mapping, {entry}, {kApp}), nullptr);
  const KSTMetadataRef old = make(33, 1, kApp);
  const KSTMetadataRef fresh = make(33, 1, kApp, true);
  ASSERT_EQ(replace(old, fresh), kKSTSuccess);
  EXPECT_TRUE(testing::storedEntry(kApp)->invalid());
}

// A move that fails while the old one is parked: it goes back, and the
// journal and the empty staging place go.
TEST_F(ReplaceTest, SwapThatStopsHalfWayIsRolledBack) {
  const KSTMetadataRef old = make(501, 2, kApp);
  const KSTMetadataRef fresh = make(501, 2, kApp, true);
  ASSERT_EQ(platform::lchflags(fresh->url().path().c_str(), platform::kFileFlagUserImmutable), 0);
  EXPECT_EQ(replace(old, fresh), kKSTErrorReplaceFailed);
  platform::lchflags(fresh->url().path().c_str(), 0);
  EXPECT_EQ(live(kApp), old);
  EXPECT_TRUE(fs::exists(old->url().path() + "/.com.zorvane.kestrel.metadata.plist"));
  EXPECT_TRUE(namesIn(replaceDirectory()).empty());
  EXPECT_TRUE(namesIn(testing::stagingDirectory()).empty());
  EXPECT_TRUE(fakes.logged(
      "Failed to replace: " + old->url().path() + " with: " + fresh->url().path() + " at: ",
      testing::Match::Contains));
}

// The states a journal can find are driven through the real daemon by the
// crash test; here, the journals that recovery cannot act on.
TEST_F(ReplaceTest, RecoveryDiscardsWhatItCannotReadAndKeepsWhatItCannotUndo) {
  const std::string classDirectory = testing::classDirectory(501, 2);
  const auto place = [&](const std::string& name) { return classDirectory + "/" + name; };
  const auto parked = [&](const std::string& name) {
    return testing::stagingDirectory() + "/" + name;
  };
  std::ofstream(replaceDirectory() + "/bad.plist") << "not a property list";
  KSTErrorRef error;
  ASSERT_TRUE(installer._recoverFromReplaceOperationsWithError(&error))
      << testing::messageOf(error);
  EXPECT_TRUE(namesIn(replaceDirectory()).empty());
  EXPECT_TRUE(
      fakes.logged("Failed to read replace file at URL " + replaceDirectory() + "/bad.plist"));

  // A roll-back that cannot be done stops recovery: that journal and the
  // ones after it stay for the next start.
  journal(place("D"), place("D2"), parked("d"), place("D2"));
  EXPECT_FALSE(installer._recoverFromReplaceOperationsWithError(&error));
  EXPECT_TRUE(
      testing::isError(error, kKSTErrorReplaceRecoveryFailed,
                       "Failed to recover replace move: " + parked("d") + " to " + place("D")));
  EXPECT_EQ(namesIn(replaceDirectory()).size(), 1u);

  // A journal must name all four places.
  EXPECT_FALSE(installer._writeToDiskReplaceAt(
      KSTFileURL(replaceDirectory() + "/x.plist"), std::nullopt, KSTFileURL("/n", true),
      KSTFileURL("/s", true), KSTFileURL("/d", true), &error));
  EXPECT_TRUE(testing::isError(error, kKSTErrorInvalidReplaceInfo,
                               "Invalid Replace File Info: old: (null), new: /n, staging: /s, "
                               "dest: /d"));
  // Values that are not absolute paths.
  ASSERT_TRUE(KST_writeToURL(PlistDictionary{{kKSTReplaceOperationOldURLKey, "relative"},
                                             {kKSTReplaceOperationNewURLKey, "/n"},
                                             {kKSTReplaceOperationStagingURLKey, 7},
                                             {kKSTReplaceOperationDestURLKey, "/d"}},
                             KSTFileURL(testing::stagingDirectory() + "/j.plist"),
                             kKSTDaemonFileWritingOptions, nullptr));
  EXPECT_FALSE(installer._readAndValidateReplaceFileAtUrl(
      KSTFileURL(testing::stagingDirectory() + "/j.plist"), &error));
  EXPECT_TRUE(
      testing::isError(error, kKSTErrorReplaceRecoveryFailed,
                       "Invalid replace data: Old: relative, New: /n, Staging: 7, Dest: /d"));
}

}  // namespace
}  // namespace kestrel
