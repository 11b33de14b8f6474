// Commands 24 and 25 through the real daemon: the data migration for the one
// client entitled to it, and the retry test's crashes, each retried against
// the daemon started again.
#include <gtest/gtest.h>

#include <string>

#include "support/registered_clients.h"

namespace kestrel {
namespace {

class MigrationEndToEndTest : public testing::RegisteredClientsTest {};

TEST_F(MigrationEndToEndTest, DataMigrationAndRetryTestAgainstARestartingDaemon) {
  registerClient("migrator", "com.example.migrator",
                 "<key>com.zorvane.private.Kestrel.dataMigration</key><true/>");
  const std::string library = "/private/var/root/Library/Kestrel/";
  scratch.writeFile(library + "kst_entitlements.plist",
                    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                    "<key>com.example.legacy</key><dict><key>com.example.e</key><true/></dict>"
                    "</dict></plist>\n");
  scratch.writeFile("/etc/kestrel/internal-build", "");

  auto daemon = std::make_unique<testing::DaemonProcess>(scratch.path());
  ASSERT_TRUE(daemon->ready());
  // "allowed" does not reach command 24.
  EXPECT_EQ(call("allowed-client", {"24"}).exitStatus, 4);
  auto migrated = call("migrator", {"24"});
  EXPECT_EQ(migrated.exitStatus, 0) << migrated.output << log();
  EXPECT_FALSE(scratch.exists(library + "kst_entitlements.plist"));
  for (const char* marker :
       {"kst_bundle_migration_complete.plist", "kst_acl2_migration_complete.plist",
        "kst_group_id_migration_complete.plist", "kst_code_signing_migration_complete.plist"}) {
    EXPECT_TRUE(scratch.exists(library + marker)) << marker;
  }
  EXPECT_NE(log().find("Migrating legacy entitlements for com.example.legacy"), std::string::npos);

  // Two crashes: each request is left without a reply and the daemon exits
  // with status 0; the third request finds the counter at its end.
  const std::vector<std::string> retry{"25", "UserID=u64:501", "NumRetryCrashes=u64:2"};
  for (int crash = 2; crash >= 1; --crash) {
    SCOPED_TRACE(crash);
    auto crashed = call("allowed-client", retry);
    EXPECT_EQ(crashed.exitStatus, 4) << crashed.output;
    EXPECT_EQ(daemon->waitForExit(), 0);
    EXPECT_NE(log().find("Crashes Remaining in retry test: " + std::to_string(crash)),
              std::string::npos);
    daemon = std::make_unique<testing::DaemonProcess>(scratch.path());
    ASSERT_TRUE(daemon->ready());
  }
  auto succeeded = call("allowed-client", retry);
  EXPECT_EQ(succeeded.exitStatus, 0) << succeeded.output << log();
  EXPECT_NE(log().find("Returning Successfully"), std::string::npos);
  auto listed = ctl("allowed-client", {"list", "--class", "2", "--user", "501"});
  EXPECT_EQ(listed.output.find("com.zorvane.retryTest"), std::string::npos) << listed.output;
  EXPECT_EQ(daemon->stop(), 0);
}

}  // namespace
}  // namespace kestrel
