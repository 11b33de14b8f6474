// Start-up and boot-time housekeeping on a scratch root: what a crash, a
// reboot or a stray writer left behind goes to death row, and the sweep at
// the end of start-up takes it away; everything that belongs stays.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "daemon/daemon_state.h"
#include "platform/uuid.h"
#include "store/global_configuration.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::namesIn;
using Strings = std::vector<std::string>;

class HousekeepingTest : public testing::StoreTest {
 protected:
  KSTClientConnection& shared = KSTClientConnection::sharedClientConnection();
  // Everything moved to death row is gone once the sweep ran.
  static void sweepEnds() {
    KSTDeathRowQueue()->sync([] {});
  }
};

TEST_F(HousekeepingTest, EveryStartRetiresStagingAndSweepsDeathRow) {
  const std::string staging = testing::stagingDirectory();
  const std::string halfBuilt = staging + "/" + platform::Uuid::random().string();
  fs::create_directories(halfBuilt + "/Library");
  std::ofstream(testing::deathRowDirectory() + "/left-by-the-last-run") << "x";
  shared.containerManagerCleanup();
  sweepEnds();
  EXPECT_TRUE(namesIn(staging).empty());
  EXPECT_TRUE(namesIn(testing::deathRowDirectory()).empty());

  // A recovery that fails is logged, and start-up goes on.
  const std::string replace = KSTGlobalConfiguration::sharedInstance().replaceDirectory().path();
  ASSERT_TRUE(installer._writeToDiskReplaceAt(
      KSTFileURL(replace + "/stuck.plist"), KSTFileURL(staging + "/gone-old", true),
      KSTFileURL(staging + "/gone-new", true), KSTFileURL(staging + "/gone-parked", true),
      KSTFileURL(staging + "/gone-dest", true), nullptr));
  shared.containerManagerSetup();
  EXPECT_TRUE(fakes.logged("Failed recovering from replace operations", testing::Match::Exact,
                           "containerManagerSetup"));
}

TEST_F(HousekeepingTest, FirstStartAfterBootRetiresTransientAndOrphanedData) {
  const KSTMetadataRef kept = make(501, 2, "com.example.kept");
  const KSTMetadataRef transient = make(501, 2, "com.example.transient", true);
  const KSTMetadataRef transientBundle = make(33, 1, "com.example.bundle", true);
  const std::string data = testing::classDirectory(501, 2);
  const std::string orphan = data + "/" + platform::Uuid::random().string();
  fs::create_directories(orphan + "/Documents");
  const std::string invalid = data + "/" + platform::Uuid::random().string();
  fs::create_directories(invalid);
  std::ofstream(invalid + "/.com.zorvane.kestrel.metadata.plist") << "not a property list";
  std::ofstream(data + "/stray-file") << "x";
  const std::string system = testing::classDirectory(499, 12);
  make(499, 12, "com.zorvane.egretd");
  fs::create_directories(system + "/com.zorvane.ternd");  // well known, but no metadata
  // A user without a home is skipped.
  fakes.accounts->addUser("gone", 503, 503, "/private/var/gone");

  shared.rebootContainerManagerCleanup();
  sweepEnds();
  EXPECT_FALSE(fs::exists(transient->url().path()));
  EXPECT_FALSE(fs::exists(transientBundle->url().path()));
  Strings expected{fs::path(invalid).filename(), fs::path(kept->url().path()).filename()};
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(namesIn(data), expected);
  EXPECT_TRUE(fs::exists(kept->url().path()));
  EXPECT_TRUE(fs::exists(invalid));
  EXPECT_FALSE(fs::exists(orphan));
  EXPECT_FALSE(fs::exists(data + "/stray-file"));
  EXPECT_EQ(namesIn(system), Strings{"com.zorvane.egretd"});
  EXPECT_TRUE(fakes.logged("Deleting orphaned data missing a metadata file at: " + orphan));
  EXPECT_TRUE(fakes.logged("Deleting orphaned data missing a metadata file at: " + system +
                           "/com.zorvane.ternd"));
  EXPECT_FALSE(
      fakes.logged("Deleting orphaned data missing a metadata file at: " + data + "/stray-file"));
  EXPECT_FALSE(fs::exists(fakes.scratch.resolve("/private/var/gone")));
}

}  // namespace
}  // namespace kestrel
