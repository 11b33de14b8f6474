// Repairing a container in place and moving it to a new directory UUID: what
// the disk, the cache and the sandbox mapping hold afterwards, and the
// addresses every per-container operation (these two, info values, metadata
// and disk usage) refuses.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <tuple>

#include "daemon/error_codes.h"
#include "platform/file_system.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

using RepairTest = testing::StoreTest;

TEST_F(RepairTest, RecreatingPutsBackARemovedSubDirectoryAsCreationMadeIt) {
  const struct {
    const char* label;
    std::uint32_t user;
    KSTContainerClass containerClass;
    const char* identifier;
    const char* removed;
  } rows[] = {
      {"data container", 501, 2, "com.example.app", "Library/Preferences"},
      {"system container: owner, mode and ACLs", 499, 12, "com.example.system", "Library"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.label);
    const KSTMetadataRef container = make(row.user, row.containerClass, row.identifier);
    ASSERT_TRUE(container);
    const std::string directory = container->url().path() + "/" + row.removed;
    const struct stat before = testing::statOf(directory);
    const std::string aclBefore = testing::aclText(directory, ACL_TYPE_ACCESS);
    fs::remove_all(directory);

    std::uint64_t code = kKSTSuccess;
    installer.recreateDefaultStructureForUser(row.user, container->uuid(), row.identifier,
                                              row.containerClass, &code);
    ASSERT_EQ(code, kKSTSuccess);
    const struct stat after = testing::statOf(directory);
    EXPECT_EQ(after.st_uid, before.st_uid);
    EXPECT_EQ(after.st_mode, before.st_mode);
    EXPECT_EQ(testing::aclText(directory, ACL_TYPE_ACCESS), aclBefore);

    // Nothing is missing any more: a second run changes nothing.
    installer.recreateDefaultStructureForUser(row.user, container->uuid(), row.identifier,
                                              row.containerClass, &code);
    EXPECT_EQ(code, kKSTSuccess);
    EXPECT_EQ(testing::statOf(directory).st_ino, after.st_ino);
  }
}

TEST_F(RepairTest, ANewDirectoryUUIDMovesTheContainerAndKeepsItsIdentity) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  const platform::Uuid internal = app->uuid();
  const std::string first = app->url().path();
  std::ofstream(first + "/Documents/note") << "kept";

  std::string previous = first;
  for (int round = 0; round < 2; ++round) {
    SCOPED_TRACE(round);
    std::uint64_t code = kKSTSuccess;
    installer.regenerateDirectoryUUIDForUser(501, internal, "com.example.app", 2, &code);
    ASSERT_EQ(code, kKSTSuccess);

    const KSTMetadataRef found =
        installer.metadataForUser(501, internal, "com.example.app", 2, &code);
    ASSERT_TRUE(found);
    const std::string moved = found->url().path();
    EXPECT_NE(moved, previous);
    EXPECT_EQ(fs::path(moved).parent_path(), fs::path(first).parent_path());
    EXPECT_NE(fs::path(moved).filename(), internal.string());
    EXPECT_TRUE(platform::Uuid::parse(fs::path(moved).filename().string()));
    EXPECT_FALSE(fs::exists(previous));
    EXPECT_EQ(found->uuid(), internal);
    std::ifstream note(moved + "/Documents/note");
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(note), {}), "kept");

    bool mapped = false;
    for (const auto& item : fakes.sandbox->userStateItems()) {
      if (item.identifier == "com.example.app") mapped = item.path == moved;
    }
    EXPECT_TRUE(mapped);
    previous = moved;
  }
}

// Every per-container operation finds its container by user, class, internal
// UUID and identifier: each refuses what cannot be named or found, alike.
TEST_F(RepairTest, ContainersThatCannotBeNamedOrFoundAreRefusedByEveryOperation) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  // On disk, but never cached: not found either.
  const KSTMetadataRef unknown = testing::writeContainer(501, 2, "com.example.unknown");
  using Address = std::tuple<std::optional<platform::Uuid>, std::string, KSTContainerClass>;
  using Operation = std::function<std::uint64_t(const Address&)>;
  const auto codeOf = [&](auto operation) {
    return [&, operation](const Address& address) {
      const auto& [uuid, identifier, containerClass] = address;
      std::uint64_t code = kKSTSuccess;
      operation(uuid, identifier, containerClass, &code);
      return code;
    };
  };
  const std::pair<const char*, Operation> operations[] = {
      {"set info value", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         installer.setInfoValue(PlistValue(true), "k", 501, u, i, c, true, e);
       })},
      {"info value", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         EXPECT_FALSE(installer.infoValueForKey("k", 501, u, i, c, true, e));
       })},
      {"metadata", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         EXPECT_FALSE(installer.metadataForUser(501, u, i, c, e));
       })},
      {"recreate", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         installer.recreateDefaultStructureForUser(501, u, i, c, e);
       })},
      {"new directory UUID", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         installer.regenerateDirectoryUUIDForUser(501, u, i, c, e);
       })},
      {"disk usage", codeOf([&](auto& u, auto& i, auto c, auto* e) {
         EXPECT_EQ(installer.diskUsageForUserId(501, u, i, c, e), 0u);
       })},
  };
  const struct {
    const char* label;
    Address address;
    std::uint64_t code;
  } rows[] = {
      {"no UUID", {std::nullopt, "com.example.app", 2}, kKSTErrorInvalidObject},
      {"class 0", {app->uuid(), "com.example.app", 0}, kKSTErrorInvalidObject},
      {"class 14", {app->uuid(), "com.example.app", 14}, kKSTErrorInvalidObject},
      {"another UUID", {platform::Uuid::random(), "com.example.app", 2}, kKSTErrorNotFound},
      {"another class", {app->uuid(), "com.example.app", 4}, kKSTErrorNotFound},
      {"not cached", {unknown->uuid(), "com.example.unknown", 2}, kKSTErrorNotFound},
  };
  for (const auto& row : rows) {
    for (const auto& [name, operation] : operations) {
      SCOPED_TRACE(std::string(row.label) + ", " + name);
      EXPECT_EQ(operation(row.address), row.code);
    }
  }
  EXPECT_TRUE(fakes.logged("Can't act on an invalid object: userId: 501, UUID: (null), Class: 2"));
  EXPECT_TRUE(fakes.logged("No Container with userId: 501 UUID: "));
  // Only the info values need a key.
  std::uint64_t code = kKSTSuccess;
  installer.setInfoValue(PlistValue(true), std::nullopt, 501, app->uuid(), "com.example.app", 2,
                         true, &code);
  EXPECT_EQ(code, kKSTErrorInvalidParameter);
  EXPECT_TRUE(fakes.logged("Can't set nil or non-Strand key: (null)"));
  EXPECT_FALSE(
      installer.infoValueForKey(std::nullopt, 501, app->uuid(), "com.example.app", 2, true, &code));
  EXPECT_EQ(code, kKSTErrorInvalidParameter);
  EXPECT_TRUE(fs::is_directory(app->url().path()));
  EXPECT_FALSE(testing::infoOnDisk(app));
}

TEST_F(RepairTest, AFailedMoveLeavesTheContainerItsMappingAndTheCacheAsTheyWere) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  const std::string path = app->url().path();
  const auto mapping = fakes.sandbox->userStateItems();
  // An immutable directory cannot be renamed, even by root.
  ASSERT_EQ(platform::lchflags(path.c_str(), platform::kFileFlagUserImmutable), 0);
  std::uint64_t code = kKSTSuccess;
  installer.regenerateDirectoryUUIDForUser(501, app->uuid(), "com.example.app", 2, &code);
  platform::lchflags(path.c_str(), 0);
  EXPECT_EQ(code, kKSTErrorRegenerateUUIDFailed);
  EXPECT_TRUE(fakes.logged("Failed to move dir: " + path + " to new UUID dir: "));
  EXPECT_EQ(testing::namesIn(fs::path(path).parent_path()),
            std::vector<std::string>{fs::path(path).filename()});
  EXPECT_EQ(installer.metadataForUser(501, app->uuid(), "com.example.app", 2, &code)->url().path(),
            path);
  EXPECT_EQ(fakes.sandbox->userStateItems(), mapping);
}

}  // namespace
}  // namespace kestrel
