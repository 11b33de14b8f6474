// Create or look up, and listing: what lands on disk, what the cache then
// says, and that bad input or a failed step leaves no trace in a class
// directory.
#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>

#include <atomic>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <thread>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "platform/linux/extended_acl_linux.h"
#include "store/container_cache.h"
#include "store/container_identifier.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kMetadata = ".com.zorvane.kestrel.metadata.plist";
constexpr uid_t kNobody = 4294967294u;

struct Owner {
  uid_t uid;
  mode_t mode;
};
Owner ownerOf(const fs::path& path) {
  struct stat st {};
  EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
  return {st.st_uid, static_cast<mode_t>(st.st_mode & 07777)};
}

std::set<std::string> entriesOf(const fs::path& directory) {
  std::set<std::string> names;
  if (!fs::exists(directory)) return names;
  for (const auto& entry : fs::recursive_directory_iterator(directory)) {
    names.insert(fs::relative(entry.path(), directory).string());
  }
  return names;
}

// Transient renewals and failed creations start death-row sweeps; they run
// on the death-row queue, and each test waits for them before its scratch
// root goes.
class DeathRowQueue {
 public:
  DeathRowQueue() { EXPECT_TRUE(KSTCreateWorkQueues()); }
  ~DeathRowQueue() {
    KSTDeathRowQueue()->sync([] {});
  }
};

class ContainerCreationTest : public ::testing::Test {
 protected:
  KSTMetadataRef create(std::uint32_t user, KSTContainerClass containerClass,
                        std::optional<std::string> identifier, std::uint64_t* code,
                        bool transient = false, bool createIfNecessary = true) {
    return client.createOrLookupContainerForUser(user, identifier, createIfNecessary,
                                                 containerClass, transient, true, code);
  }
  fs::path classDirectory(std::uint32_t user, KSTContainerClass containerClass,
                          bool transient = false) {
    return KSTGlobalConfiguration::sharedInstance()
        .containerDirectoryURLForUser(user, containerClass, transient)
        .value_or(KSTFileURL())
        .path();
  }
  fs::path staging() { return KSTGlobalConfiguration::sharedInstance().stagingDirectory().path(); }
  fs::path deathRow() {
    return KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  }
  // What lies on death row, below the per-item holders.
  std::set<std::string> retired() {
    std::set<std::string> names;
    if (!fs::exists(deathRow())) return names;
    for (const auto& holder : fs::directory_iterator(deathRow())) {
      for (const auto& item : fs::directory_iterator(holder)) {
        names.insert(item.path().filename().string());
      }
    }
    return names;
  }
  void useLinuxACLs() {
    fakes.services.extendedACL = std::make_shared<platform::LinuxExtendedACL>(fakes.accounts);
    fakes.install();
  }

  testing::FakeServices fakes;
  DeathRowQueue deathRowQueue;
  KSTClientConnection client{std::string("com.example.installer"), 0, true, std::nullopt};
};

TEST_F(ContainerCreationTest, DataContainerIsMadeOnceAndFoundAfterwards) {
  // Not found without creation, and silently.
  std::uint64_t code = kKSTSuccess;
  EXPECT_FALSE(create(501, 2, "com.example.app", &code, false, false));
  EXPECT_EQ(code, kKSTErrorNotFound);
  EXPECT_FALSE(fakes.logged("Not Found"));
  EXPECT_TRUE(entriesOf(classDirectory(501, 2)).empty());

  code = kKSTSuccess;
  KSTMetadataRef made = create(501, 2, "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  EXPECT_FALSE(made->existed());
  const fs::path directory = made->url().path();
  EXPECT_EQ(directory.parent_path(), classDirectory(501, 2));
  EXPECT_NE(directory.filename().string(), made->uuid().string());
  EXPECT_EQ(entriesOf(directory),
            (std::set<std::string>{kMetadata, "Documents", "Library", "Library/Caches",
                                   "Library/Preferences", "tmp"}));
  for (const char* name : {"", "Library/Caches"}) {
    EXPECT_EQ(ownerOf(directory / name).uid, 501u) << name;
    EXPECT_EQ(ownerOf(directory / name).mode, 0755u) << name;
  }
  EXPECT_TRUE(fs::is_empty(staging()));

  KSTMetadataRef again = create(501, 2, "com.example.app", &code, false, false);
  ASSERT_TRUE(again) << code;
  EXPECT_TRUE(again->existed());
  EXPECT_EQ(again->uuid(), made->uuid());
  EXPECT_EQ(fs::directory_iterator(classDirectory(501, 2))->path(), directory);
}

TEST_F(ContainerCreationTest, EachKindGetsItsOwnersModesAndSubDirectories) {
  useLinuxACLs();
  struct Row {
    std::uint32_t user;
    KSTContainerClass containerClass;
    const char* identifier;
    uid_t topOwner;
    uid_t subOwner;
    mode_t subMode;
    std::set<std::string> subDirectories;
  };
  const std::set<std::string> group = {"Library", "Library/Caches"};
  const std::set<std::string> data = {"Documents", "Library", "Library/Caches",
                                      "Library/Preferences", "tmp"};
  const Row rows[] = {
      {33, 1, "com.example.app", 33, 0, 0, {}},
      {501, 7, "group.com.example.shared", 501, 501, 0755, group},
      {499, 12, "com.example.daemon", 0, kNobody, 0, data},
      {499, 13, "systemgroup.com.example.shared", 0, kNobody, 0, group},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.containerClass);
    std::uint64_t code = kKSTSuccess;
    KSTMetadataRef made = create(row.user, row.containerClass, row.identifier, &code);
    ASSERT_TRUE(made) << code;
    const fs::path top = made->url().path();
    std::set<std::string> expected = row.subDirectories;
    expected.insert(kMetadata);
    EXPECT_EQ(entriesOf(top), expected);
    // Where an ACL holds named entries, the group bits of the mode show its
    // mask; the owner and other bits are the mode's own.
    EXPECT_EQ(ownerOf(top).uid, row.topOwner);
    EXPECT_EQ(ownerOf(top).mode & 0707, 0705u);
    for (const std::string& name : row.subDirectories) {
      SCOPED_TRACE(name);
      EXPECT_EQ(ownerOf(top / name).uid, row.subOwner);
      EXPECT_EQ(ownerOf(top / name).mode & 0707, row.subMode & 0707);
    }
    if (!KSTIsSystemClass(row.containerClass)) continue;
    // Closed by mode, open to the system users through the list: the mask
    // must not take back what the group entry grants.
    const platform::UniquePosixACL acl(
        acl_get_file((top / "Library/Caches").c_str(), ACL_TYPE_ACCESS));
    ASSERT_TRUE(acl);
    char* text = acl_to_any_text(acl.get(), nullptr, ',', TEXT_NUMERIC_IDS);
    const std::string aclText = text;
    acl_free(text);
    EXPECT_NE(aclText.find("group:499:rwx"), std::string::npos) << aclText;
    EXPECT_NE(aclText.find("mask::rwx"), std::string::npos) << aclText;
  }
}

TEST_F(ContainerCreationTest, TransientContainersAreRenewedEveryTime) {
  std::uint64_t code = kKSTSuccess;
  KSTMetadataRef first = create(501, 11, "com.example.tmp", &code, true);
  ASSERT_TRUE(first) << code;
  EXPECT_EQ(fs::path(first->url().path()).parent_path(), classDirectory(501, 11, true));

  KSTMetadataRef second = create(501, 11, "com.example.tmp", &code, true);
  ASSERT_TRUE(second) << code;
  EXPECT_FALSE(second->existed());
  EXPECT_NE(second->url(), first->url());
  EXPECT_NE(second->uuid(), first->uuid());
  EXPECT_FALSE(fs::exists(first->url().path()));

  // Asked for without creation, the old one still goes, and nothing comes back.
  EXPECT_FALSE(create(501, 11, "com.example.tmp", &code, true, false));
  EXPECT_EQ(code, kKSTErrorNotFound);
  EXPECT_FALSE(fs::exists(second->url().path()));
  // ... after which the identifier can be made again.
  code = kKSTSuccess;
  EXPECT_TRUE(create(501, 11, "com.example.tmp", &code, true)) << code;
}

TEST_F(ContainerCreationTest, BadInputIsRefusedAndMakesNothing) {
  const std::string longIdentifier(kKSTMaxIdentifierLength + 1, 'a');
  struct Row {
    std::uint32_t user;
    KSTContainerClass containerClass;
    std::optional<std::string> identifier;
    const char* logged;
  };
  const Row rows[] = {
      {501, 0, "com.example.app",
       "Can't act on an invalid object: userId: 501, ID: com.example.app, class: 0"},
      {501, 2, std::nullopt, "ID: (null), class: 2"},
      {501, 2, "com/example", "ID: com/example, class: 2"},
      {501, 2, std::string("com\0x", 5), "Can't act on an invalid object"},
      {501, 2, longIdentifier, "... (1025 bytes), class: 2"},
      {33, 2, "com.example.app", "Invalid userId 33 for class 2, ID: com.example.app"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.logged);
    std::uint64_t code = kKSTSuccess;
    EXPECT_FALSE(create(row.user, row.containerClass, row.identifier, &code));
    EXPECT_EQ(code, kKSTErrorInvalidObject);
    EXPECT_TRUE(fakes.logged(row.logged));
  }
  EXPECT_TRUE(entriesOf(classDirectory(501, 2)).empty());
  EXPECT_TRUE(fs::is_empty(staging()));
  EXPECT_TRUE(retired().empty());

  std::uint64_t code = kKSTSuccess;
  EXPECT_TRUE(create(33, 1, "com.example.app", &code)) << code;
}

TEST_F(ContainerCreationTest, SystemContainerNeedsTheEntitlementUnlessOtherIdsMayBeNamed) {
  KSTClientConnection plain(std::string("com.example.daemon"), 0, false, std::nullopt);
  std::uint64_t code = kKSTSuccess;
  EXPECT_FALSE(plain.createOrLookupContainerForUser(499, "com.example.daemon", true, 12, false,
                                                    true, &code));
  EXPECT_EQ(code, kKSTErrorNotEntitled);
  EXPECT_TRUE(fakes.logged(
      "com.example.daemon not entitled for a system container, but com.example.daemon is trying"));
  // System groups are not checked here.
  code = kKSTSuccess;
  EXPECT_TRUE(plain.createOrLookupContainerForUser(499, "systemgroup.com.example.x", true, 13,
                                                   false, true, &code))
      << code;
}

TEST_F(ContainerCreationTest, CachedContainerWithoutMetadataIsInconsistent) {
  std::uint64_t code = kKSTSuccess;
  KSTMetadataRef made = create(501, 2, "com.example.app", &code);
  ASSERT_TRUE(made);
  fs::remove(fs::path(made->url().path()) / kMetadata);
  EXPECT_FALSE(create(501, 2, "com.example.app", &code));
  EXPECT_EQ(code, kKSTErrorCacheInconsistent);
  // The old container and its five sub-directories, nothing new.
  EXPECT_EQ(entriesOf(classDirectory(501, 2)).size(), 6u);
}

TEST_F(ContainerCreationTest, WellKnownSystemContainerTakesItsNameAndAFailedMoveLeavesNoTrace) {
  std::uint64_t code = kKSTSuccess;
  KSTMetadataRef known = create(499, 12, "com.zorvane.egretd", &code);
  ASSERT_TRUE(known) << code;
  EXPECT_EQ(fs::path(known->url().path()), classDirectory(499, 12) / "com.zorvane.egretd");

  // Something else already occupies the other well-known name: the rename fails.
  const fs::path occupied = classDirectory(499, 12) / "com.zorvane.ternd";
  fs::create_directories(occupied / "left-over");
  code = kKSTSuccess;
  EXPECT_FALSE(create(499, 12, "com.zorvane.ternd", &code));
  EXPECT_EQ(code, kKSTErrorMoveStagingFailed);
  EXPECT_EQ(entriesOf(occupied), std::set<std::string>{"left-over"});
  EXPECT_EQ(entriesOf(classDirectory(499, 12)).count("com.zorvane.ternd/" + std::string(kMetadata)),
            0u);
  EXPECT_TRUE(fs::is_empty(staging()));
}

TEST_F(ContainerCreationTest, ListingGivesEveryContainerOfTheClass) {
  std::uint64_t code = kKSTSuccess;
  ASSERT_TRUE(create(501, 2, "com.example.a", &code));
  ASSERT_TRUE(create(501, 2, "com.example.b", &code));
  ASSERT_TRUE(create(501, 2, "com.example.t", &code, true));
  auto listed = client.containersForUser(501, 2, false, &code);
  ASSERT_TRUE(listed) << code;
  std::set<std::string> identifiers;
  for (const auto& record : *listed) identifiers.insert(record->identifier());
  EXPECT_EQ(identifiers, (std::set<std::string>{"com.example.a", "com.example.b"}));

  EXPECT_FALSE(client.containersForUser(501, 14, false, &code));
  EXPECT_EQ(code, kKSTErrorInvalidObject);
  EXPECT_TRUE(fakes.logged("Can't act on an invalid container-userId: 501, class: 14"));
}

// Many requests for the same few identifiers at once, as the listener's
// concurrent queue would run them: each identifier ends with one container,
// and nothing is left half-built.
TEST(ContainerCreationConcurrencyTest, RacingRequestsLeaveOneContainerPerIdentifier) {
  testing::FakeServices fakes;
  DeathRowQueue deathRowQueue;
  const std::vector<std::string> identifiers = {"com.example.a", "com.example.b", "com.example.c"};
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      KSTClientConnection client(std::string("com.example.installer"), 0, true, std::nullopt);
      for (int i = 0; i < 15; ++i) {
        const std::string& identifier = identifiers[(t + i) % identifiers.size()];
        std::uint64_t code = kKSTSuccess;
        const bool transient = i % 5 == 4;
        if (!client.createOrLookupContainerForUser(501, identifier, true, transient ? 11 : 2,
                                                   transient, true, &code)) {
          ++failures;
        }
        if (i % 4 == 0 && !client.containersForUser(501, 2, false, &code)) ++failures;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);

  std::map<std::string, int> containersOf;
  const fs::path classDirectory =
      KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(501, 2, false)->path();
  for (const auto& entry : fs::directory_iterator(classDirectory)) {
    auto record = KSTMetadata::readAndValidateMetadataAtUrl(KSTFileURL(entry.path(), true), 501,
                                                            true, nullptr);
    ASSERT_TRUE(record) << entry.path();
    ++containersOf[record->identifier()];
  }
  EXPECT_EQ(containersOf, (std::map<std::string, int>{
                              {"com.example.a", 1}, {"com.example.b", 1}, {"com.example.c", 1}}));
  EXPECT_TRUE(fs::is_empty(KSTGlobalConfiguration::sharedInstance().stagingDirectory().path()));
}

}  // namespace
}  // namespace kestrel
