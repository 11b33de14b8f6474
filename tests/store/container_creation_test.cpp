// Create or look up, and listing: what lands on disk, what the cache then
// says, and that bad input or a failed step leaves no trace in a class
// directory.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <thread>

#include "daemon/error_codes.h"
#include "platform/linux/extended_acl_linux.h"
#include "store/container_class.h"
#include "store/container_identifier.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::classDirectory;
using testing::modeOf;
using testing::namesIn;
using testing::ownerOf;
using Names = std::set<std::string>;

constexpr const char* kMetadata = ".com.zorvane.kestrel.metadata.plist";

// Every name below a directory, at any depth.
Names treeOf(const std::string& directory) {
  Names names;
  if (!fs::exists(directory)) return names;
  for (const auto& entry : fs::recursive_directory_iterator(directory)) {
    names.insert(fs::relative(entry.path(), directory).string());
  }
  return names;
}

class ContainerCreationTest : public testing::StoreTest {
 protected:
  KSTMetadataRef create(std::uint32_t user, KSTContainerClass containerClass,
                        std::optional<std::string> identifier, std::uint64_t* code,
                        bool transient = false, bool createIfNecessary = true) {
    *code = kKSTSuccess;
    return installer.createOrLookupContainerForUser(user, identifier, createIfNecessary,
                                                    containerClass, transient, true, code);
  }
};

TEST_F(ContainerCreationTest, DataContainerIsMadeOnceFoundListedAndInconsistentWithoutMetadata) {
  std::uint64_t code;
  // Not found without creation, and silently.
  EXPECT_FALSE(create(501, 2, "com.example.app", &code, false, false));
  EXPECT_EQ(code, kKSTErrorNotFound);
  EXPECT_FALSE(fakes.logged("Not Found"));
  EXPECT_TRUE(namesIn(classDirectory(501, 2)).empty());

  KSTMetadataRef made = create(501, 2, "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  EXPECT_FALSE(made->existed());
  const fs::path directory = made->url().path();
  EXPECT_EQ(directory.parent_path(), classDirectory(501, 2));
  EXPECT_NE(directory.filename().string(), made->uuid().string());
  EXPECT_EQ(treeOf(directory), (Names{kMetadata, "Documents", "Library", "Library/Caches",
                                      "Library/Preferences", "tmp"}));
  for (const char* name : {"", "Library/Caches"}) {
    EXPECT_EQ(ownerOf(directory / name), 501u) << name;
    EXPECT_EQ(modeOf(directory / name), 0755u) << name;
  }
  EXPECT_TRUE(fs::is_empty(testing::stagingDirectory()));
  KSTMetadataRef again = create(501, 2, "com.example.app", &code, false, false);
  ASSERT_TRUE(again) << code;
  EXPECT_TRUE(again->existed());
  EXPECT_EQ(again->uuid(), made->uuid());
  EXPECT_EQ(namesIn(classDirectory(501, 2)), std::vector{directory.filename().string()});

  // Listing gives the live containers of the class.
  ASSERT_TRUE(create(501, 2, "com.example.b", &code));
  ASSERT_TRUE(create(501, 2, "com.example.t", &code, true));
  auto listed = installer.containersForUser(501, 2, false, &code);
  ASSERT_TRUE(listed) << code;
  Names identifiers;
  for (const auto& record : *listed) identifiers.insert(record->identifier());
  EXPECT_EQ(identifiers, (Names{"com.example.app", "com.example.b"}));
  EXPECT_FALSE(installer.containersForUser(501, 14, false, &code));
  EXPECT_EQ(code, kKSTErrorInvalidObject);
  EXPECT_TRUE(fakes.logged("Can't act on an invalid container-userId: 501, class: 14"));

  // The cached container's metadata goes: inconsistent, and nothing is made or rewritten.
  fs::remove(directory / kMetadata);
  EXPECT_FALSE(create(501, 2, "com.example.app", &code));
  EXPECT_EQ(code, kKSTErrorCacheInconsistent);
  EXPECT_EQ(namesIn(classDirectory(501, 2)).size(), 2u);
  EXPECT_EQ(treeOf(directory).size(), 5u);  // the sub-directories, and no metadata
}

TEST_F(ContainerCreationTest, EachKindGetsItsOwnersModesAndSubDirectories) {
  fakes.services.extendedACL = std::make_shared<platform::LinuxExtendedACL>(fakes.accounts);
  fakes.install();
  const Names group = {"Library", "Library/Caches"};
  const Names data = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
  constexpr uid_t kNobody = 4294967294u;
  const std::tuple<std::uint32_t, KSTContainerClass, const char*, uid_t, uid_t, mode_t, Names>
      rows[] = {
          {33, 1, "com.example.app", 33, 0, 0, {}},
          {501, 7, "group.com.example.shared", 501, 501, 0755, group},
          {499, 12, "com.example.daemon", 0, kNobody, 0, data},
          {499, 13, "systemgroup.com.example.shared", 0, kNobody, 0, group},
      };
  for (const auto& [user, containerClass, identifier, topOwner, subOwner, subMode, subDirectories] :
       rows) {
    SCOPED_TRACE(containerClass);
    KSTMetadataRef made = make(user, containerClass, identifier);
    ASSERT_TRUE(made);
    const fs::path top = made->url().path();
    Names expected = subDirectories;
    expected.insert(kMetadata);
    EXPECT_EQ(treeOf(top), expected);
    // Where an ACL holds named entries, the group bits of the mode show its
    // mask; the owner and other bits are the mode's own.
    EXPECT_EQ(ownerOf(top), topOwner);
    EXPECT_EQ(modeOf(top) & 0707, 0705u);
    for (const std::string& name : subDirectories) {
      EXPECT_EQ(ownerOf(top / name), subOwner) << name;
      EXPECT_EQ(modeOf(top / name) & 0707, subMode & 0707) << name;
    }
    if (!KSTIsSystemClass(containerClass)) continue;
    // Closed by mode, open to the system users through the list: the mask
    // must not take back what the group entry grants.
    const std::string acl = testing::aclText(top / "Library/Caches", ACL_TYPE_ACCESS);
    EXPECT_NE(acl.find("group:499:rwx"), std::string::npos) << acl;
    EXPECT_NE(acl.find("mask::rwx"), std::string::npos) << acl;
  }
}

TEST_F(ContainerCreationTest, TransientContainersAreRenewedEveryTime) {
  std::uint64_t code;
  KSTMetadataRef first = create(501, 11, "com.example.tmp", &code, true);
  ASSERT_TRUE(first) << code;
  EXPECT_EQ(fs::path(first->url().path()).parent_path(), classDirectory(501, 11, true));
  KSTMetadataRef second = create(501, 11, "com.example.tmp", &code, true);
  ASSERT_TRUE(second) << code;
  EXPECT_FALSE(second->existed());
  EXPECT_NE(second->url(), first->url());
  EXPECT_NE(second->uuid(), first->uuid());
  EXPECT_FALSE(fs::exists(first->url().path()));
  // Asked for without creation, the old one still goes, and nothing comes back...
  EXPECT_FALSE(create(501, 11, "com.example.tmp", &code, true, false));
  EXPECT_EQ(code, kKSTErrorNotFound);
  EXPECT_FALSE(fs::exists(second->url().path()));
  // ... after which the identifier can be made again.
  EXPECT_TRUE(create(501, 11, "com.example.tmp", &code, true)) << code;
}

TEST_F(ContainerCreationTest, BadInputOrAMissingEntitlementIsRefusedAndMakesNothing) {
  const std::string longIdentifier(kKSTMaxIdentifierLength + 1, 'a');
  const std::tuple<std::uint32_t, KSTContainerClass, std::optional<std::string>, const char*>
      rows[] = {
          {501, 0, "com.example.app",
           "Can't act on an invalid object: userId: 501, ID: com.example.app, class: 0"},
          {501, 2, std::nullopt, "ID: (null), class: 2"},
          {501, 2, "com/example", "ID: com/example, class: 2"},
          {501, 2, std::string("com\0x", 5), "Can't act on an invalid object"},
          {501, 2, longIdentifier, "... (1025 bytes), class: 2"},
          {33, 2, "com.example.app", "Invalid userId 33 for class 2, ID: com.example.app"},
      };
  std::uint64_t code;
  for (const auto& [user, containerClass, identifier, logged] : rows) {
    SCOPED_TRACE(logged);
    EXPECT_FALSE(create(user, containerClass, identifier, &code));
    EXPECT_EQ(code, kKSTErrorInvalidObject);
    EXPECT_TRUE(fakes.logged(logged));
  }
  // A system container needs the entitlement unless other ids may be named;
  // system groups are not checked here.
  KSTClientConnection plain(std::string("com.example.daemon"), 0, false, std::nullopt);
  EXPECT_FALSE(plain.createOrLookupContainerForUser(499, "com.example.daemon", true, 12, false,
                                                    true, &code));
  EXPECT_EQ(code, kKSTErrorNotEntitled);
  EXPECT_TRUE(fakes.logged(
      "com.example.daemon not entitled for a system container, but com.example.daemon is trying"));
  EXPECT_TRUE(namesIn(classDirectory(501, 2)).empty());
  EXPECT_TRUE(namesIn(classDirectory(499, 12)).empty());
  EXPECT_TRUE(fs::is_empty(testing::stagingDirectory()));
  const std::string deathRow = testing::deathRowDirectory();
  for (const std::string& holder : namesIn(deathRow)) {
    EXPECT_TRUE(namesIn(deathRow + "/" + holder).empty()) << holder;
  }
  EXPECT_TRUE(plain.createOrLookupContainerForUser(499, "systemgroup.com.example.x", true, 13,
                                                   false, true, &code))
      << code;
  EXPECT_TRUE(create(33, 1, "com.example.app", &code)) << code;
}

TEST_F(ContainerCreationTest, WellKnownSystemContainerTakesItsNameAndAFailedMoveLeavesNoTrace) {
  std::uint64_t code;
  KSTMetadataRef known = create(499, 12, "com.zorvane.egretd", &code);
  ASSERT_TRUE(known) << code;
  const fs::path system = classDirectory(499, 12);
  EXPECT_EQ(fs::path(known->url().path()), system / "com.zorvane.egretd");
  // Something else already occupies the other well-known name: the rename fails.
  fs::create_directories(system / "com.zorvane.ternd/left-over");
  EXPECT_FALSE(create(499, 12, "com.zorvane.ternd", &code));
  EXPECT_EQ(code, kKSTErrorMoveStagingFailed);
  // Logged under the operation's name, not its helper's.
  EXPECT_TRUE(fakes.logged("Failed to move staging dir: ", testing::Match::Contains,
                           "createOrLookupContainerForUser"));
  EXPECT_EQ(treeOf(system / "com.zorvane.ternd"), Names{"left-over"});
  EXPECT_TRUE(fs::is_empty(testing::stagingDirectory()));
}

using ContainerCreationConcurrencyTest = ContainerCreationTest;

// Many requests for the same few identifiers at once, as the listener's
// concurrent queue would run them: each identifier ends with one container,
// and nothing is left half-built.
TEST_F(ContainerCreationConcurrencyTest, RacingRequestsLeaveOneContainerPerIdentifier) {
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
  for (const auto& entry : fs::directory_iterator(classDirectory(501, 2))) {
    auto record = KSTMetadata::readAndValidateMetadataAtUrl(KSTFileURL(entry.path(), true), 501,
                                                            true, nullptr);
    ASSERT_TRUE(record) << entry.path();
    ++containersOf[record->identifier()];
  }
  EXPECT_EQ(containersOf, (std::map<std::string, int>{
                              {"com.example.a", 1}, {"com.example.b", 1}, {"com.example.c", 1}}));
  EXPECT_TRUE(fs::is_empty(testing::stagingDirectory()));
}

}  // namespace
}  // namespace kestrel
