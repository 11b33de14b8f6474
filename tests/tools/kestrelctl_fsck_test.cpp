// kestrelctl fsck on a store made by the daemon's own creation code, then
// damaged in the ways it must notice.
#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "daemon/client_connection.h"
#include "kestrelctl/fsck.h"
#include "platform/uuid.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using Pairs = std::set<std::pair<std::string, std::string>>;

bool mentions(const kestrelctl::FsckReport& report, const std::string& text) {
  for (const std::string& problem : report.problems) {
    if (problem.find(text) != std::string::npos) return true;
  }
  return false;
}

TEST(KestrelctlFsckTest, CleanStoreThenEachKindOfDamage) {
  testing::FakeServices fakes;
  KSTClientConnection client(std::string("com.example.installer"), 0, true, std::nullopt);
  std::uint64_t code = kKSTSuccess;
  KSTMetadataRef app =
      client.createOrLookupContainerForUser(501, "com.example.app", true, 2, false, true, &code);
  ASSERT_TRUE(app) << code;
  KSTMetadataRef egret = client.createOrLookupContainerForUser(499, "com.zorvane.egretd", true, 12,
                                                               false, true, &code);
  ASSERT_TRUE(egret) << code;

  // The daemon's view: exactly what is on disk for class 2 of user 501.
  Pairs daemonView{{"com.example.app", app->uuid().string()}};
  const kestrelctl::ListContainers list = [&](std::uint32_t user, KSTContainerClass c,
                                              bool transient,
                                              std::string*) -> std::optional<Pairs> {
    if (user == 501 && c == 2 && !transient) return daemonView;
    if (user == 499 && c == 12 && !transient) {
      return Pairs{{"com.zorvane.egretd", egret->uuid().string()}};
    }
    return Pairs{};
  };
  kestrelctl::FsckReport report = kestrelctl::checkContainerStore(nullptr);
  EXPECT_TRUE(report.problems.empty()) << report.problems.front();
  EXPECT_EQ(report.containers, 2u);

  // Not in the daemon's cache / only in it.
  daemonView = {{"com.example.gone", "00000000-0000-0000-0000-000000000000"}};
  report = kestrelctl::checkContainerStore(list);
  EXPECT_TRUE(mentions(report, "on disk but not in the daemon's cache: com.example.app"));
  EXPECT_TRUE(mentions(report, "in the daemon's cache but not on disk: com.example.gone"));

  // A stray directory, a second container of one identifier, a staging leftover.
  const fs::path classDirectory = fs::path(app->url().path()).parent_path();
  fs::create_directories(classDirectory / "STRAY");
  const fs::path copy = classDirectory / platform::Uuid::random().string();
  fs::copy(app->url().path(), copy, fs::copy_options::recursive);
  fs::create_directories(
      fs::path(KSTGlobalConfiguration::sharedInstance().stagingDirectory().path()) / "HALF");
  report = kestrelctl::checkContainerStore(list);
  EXPECT_TRUE(mentions(report, "STRAY: not a valid container"));
  EXPECT_TRUE(mentions(report, "com.example.app has 2 containers"));
  EXPECT_TRUE(mentions(report, "HALF: left in staging"));

  // Offline, staging and journals are what the next start finishes; only a
  // journal it could not recover from is a problem.
  fs::remove_all(classDirectory / "STRAY");
  fs::remove_all(copy);
  const std::string staging = KSTGlobalConfiguration::sharedInstance().stagingDirectory().path();
  const auto journal = [&](const std::string& name, const std::string& old) {
    const std::string path =
        KSTGlobalConfiguration::sharedInstance().replaceDirectory().path() + "/" + name;
    ASSERT_TRUE(client._writeToDiskReplaceAt(
        KSTFileURL(path), KSTFileURL(old, true), KSTFileURL(staging + "/new", true),
        KSTFileURL(staging + "/HALF", true), KSTFileURL(staging + "/dest", true), nullptr));
  };
  journal("parked.plist", staging + "/old");
  journal("another.plist", staging + "/gone");
  fs::remove_all(staging + "/HALF");
  report = kestrelctl::checkContainerStore(nullptr);
  EXPECT_EQ(report.problems.size(), 2u);
  EXPECT_TRUE(mentions(report, "parked.plist: replace journal, cannot be recovered"));
  fs::create_directories(staging + "/HALF");
  report = kestrelctl::checkContainerStore(nullptr);
  ASSERT_EQ(report.pending.size(), 3u);
  EXPECT_NE(report.pending[0].find("replace journal, old container parked: the next start moves"),
            std::string::npos);
  EXPECT_NE(report.pending[2].find("HALF: left in staging: the next start retires it"),
            std::string::npos);
}

}  // namespace
}  // namespace kestrel
