#include "codesigning/system_container_acls.h"

#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "platform/fake/fake_extended_acl.h"
#include "platform/linux/extended_acl_linux.h"
#include "store/file_manager.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using platform::AccessControlEntry;
using platform::AccessControlList;
using testing::aclText;
using testing::isError;

constexpr gid_t kSystemUsersGid = 499;  // "systemusers" in the scratch root's accounts

AccessControlEntry allow(std::uint32_t permissions, std::uint32_t flags) {
  return {platform::kACLTagExtendedAllow, permissions, flags,
          platform::groupMembershipUUID(kSystemUsersGid)};
}
const AccessControlList kTopLevel{{allow(16382, 352), allow(1572, 0)}};
const AccessControlList kDirectory{{allow(16382, 96)}};
const AccessControlList kFile{{allow(16318, 16)}};

class SystemContainerACLsTest : public ::testing::Test {
 protected:
  std::string path(const std::string& relative) const {
    return fakes.scratch.path() + "/" + relative;
  }
  KSTFileURL url(const std::string& relative) const { return KSTFileURL(path(relative), true); }
  void makeFile(const std::string& relative, mode_t mode = 0644) {
    fs::create_directories(fs::path(path(relative)).parent_path());
    std::ofstream(path(relative)) << "contents";
    ASSERT_EQ(::chmod(path(relative).c_str(), mode), 0);
  }
  // A container with a metadata file, directories, a file and two links.
  void makeContainer(const std::string& relative) {
    makeFile(relative + "/.com.zorvane.kestrel.metadata.plist");
    makeFile(relative + "/Library/Preferences/prefs.plist", 0600);
    fs::create_directories(path(relative + "/tmp"));
    makeFile("outside/target");
    fs::create_symlink(path("outside/target"), path(relative + "/Library/link"));
    fs::create_symlink(path("outside"), path(relative + "/tmp/dirlink"));
  }
  template <typename Service>
  std::shared_ptr<Service> use() {
    auto service = std::make_shared<Service>(fakes.accounts);
    fakes.services.extendedACL = service;
    fakes.install();
    return service;
  }
  static std::optional<AccessControlList> recorded(platform::ExtendedACL& service,
                                                   const std::string& file) {
    AccessControlList acl;
    if (service.getFile(file.c_str(), platform::kACLTypeExtended, &acl) != 0) return std::nullopt;
    return acl;
  }
  static bool hasAnyACL(const std::string& file) {
    char buffer[8];
    const bool record = ::lgetxattr(file.c_str(), platform::kExtendedACLAttribute, buffer, 0) >= 0;
    const platform::UniquePosixACL acl(acl_get_file(file.c_str(), ACL_TYPE_ACCESS));
    return record || (acl && acl_equiv_mode(acl.get(), nullptr) != 0);
  }

  testing::FakeServices fakes;
  const KSTFileManager& fm = KSTFileManager::defaultManager();
};

TEST_F(SystemContainerACLsTest, TreeGetsTheTemplatesAndTheKernelGrantsTheSystemUsersAlone) {
  auto service = use<platform::LinuxExtendedACL>();
  makeContainer("C");
  KSTErrorRef error;
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(url("C"), &error)) << error;

  // The top keeps its mode and owner (rwx r-x r-x, root) and lets the group list, search
  // and add (plus the sticky bit); below, mode 0000 and the grant alone.
  const std::string inherited = "user::rwx,group::---,group:499:rwx,mask::rwx,other::---";
  const std::string below = "user::---,group::---,group:499:rwx,mask::rwx,other::---";
  const std::tuple<const char*, const AccessControlList*, std::string, std::string> rows[] = {
      {"C", &kTopLevel, "user::rwx,group::r-x,group:499:rwx,mask::rwx,other::r-x", inherited},
      {"C/Library", &kDirectory, below, inherited},
      {"C/tmp", &kDirectory, below, inherited},
      {"C/Library/Preferences/prefs.plist", &kFile, below, "<none>"},
  };
  for (const auto& [item, record, access, defaults] : rows) {
    SCOPED_TRACE(item);
    EXPECT_EQ(recorded(*service, path(item)), *record);
    EXPECT_EQ(aclText(path(item), ACL_TYPE_ACCESS), access);
    EXPECT_EQ(aclText(path(item), ACL_TYPE_DEFAULT), defaults);
    const struct stat st = testing::statOf(path(item));
    const bool top = record == &kTopLevel;
    EXPECT_EQ(st.st_uid, top ? 0u : kKSTSystemContainerItemOwner);
    EXPECT_EQ(st.st_gid, top ? 0u : kKSTSystemContainerItemGroup);
  }
  // The metadata file, the links and what they point to are left alone.
  for (const char* untouched : {"C/.com.zorvane.kestrel.metadata.plist", "C/Library/link",
                                "C/tmp/dirlink", "outside/target", "outside"}) {
    EXPECT_FALSE(hasAnyACL(path(untouched))) << untouched;
    EXPECT_EQ(testing::ownerOf(path(untouched)), 0u) << untouched;
  }

  // What members may do there is checked with real processes end to end.
  EXPECT_EQ(testing::modeOf(path("C")) & S_ISVTX, S_ISVTX);
  EXPECT_EQ(testing::modeOf(path("C/Library")) & S_ISVTX, 0u);
}

TEST_F(SystemContainerACLsTest, SharedContentAndTopLevelOnlyAndAMissingGroup) {
  auto service = use<platform::LinuxExtendedACL>();
  // Shared content treats the start like any directory.
  makeFile("S/sub/file");
  ASSERT_TRUE(fm.standardizeACLsAtURL(url("S"), false, nullptr));
  EXPECT_EQ(recorded(*service, path("S")), kDirectory);
  EXPECT_EQ(testing::modeOf(path("S")) & 0707, 0u);
  EXPECT_EQ(testing::ownerOf(path("S")), kKSTSystemContainerItemOwner);
  EXPECT_EQ(recorded(*service, path("S/sub/file")), kFile);

  // The top-level list on one path only.
  fs::create_directories(path("T/inside"));
  ASSERT_EQ(::chmod(path("T/inside").c_str(), 0000), 0);
  ASSERT_EQ(::chmod(path("T").c_str(), 0000), 0);
  ASSERT_TRUE(fm.setTopLevelSystemContainerACLAtURL(url("T"), nullptr));
  EXPECT_EQ(recorded(*service, path("T")), kTopLevel);
  EXPECT_FALSE(hasAnyACL(path("T/inside")));
  KSTErrorRef error;
  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(url("missing"), &error));
  EXPECT_TRUE(isError(error, 63,
                      "Failed to set ACL on " + path("missing") + ": No such file or directory"));

  // Without the group: 63, and nothing is touched.
  fakes.accounts->removeGroup("systemusers");
  makeContainer("C");
  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(url("C"), &error));
  EXPECT_TRUE(isError(error, 63,
                      "Failed to look up the membership UUID of group systemusers: No such file or "
                      "directory"));
  EXPECT_FALSE(fm.standardizeACLsForSystemContainerAtURL(url("C"), nullptr));
  EXPECT_FALSE(hasAnyACL(path("C")));
  EXPECT_FALSE(hasAnyACL(path("C/Library")));
}

// One step of each kind of message; the other steps repeat the "acl_init()" pattern.
TEST_F(SystemContainerACLsTest, EachBuildingStepFailsWithItsOwnMessage) {
  const std::string eio = std::strerror(EIO);
  const std::pair<const char*, std::string> rows[] = {
      {"acl_init", "acl_init() failed: " + eio},
      {"lookup_group_uuid", "Failed to look up the membership UUID of group systemusers: " + eio},
      {"acl_add_perm", "acl_add_perm() failed to set perms 3ffe: " + eio},
      {"acl_add_flag_np", "acl_add_flag_np() failed to set flags 160: " + eio},
  };
  auto service = use<platform::FakeExtendedACL>();
  makeContainer("C");
  for (const auto& [step, message] : rows) {
    SCOPED_TRACE(step);
    service->clearFailures();
    service->failStep(step, EIO);
    KSTErrorRef top, tree;
    EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(url("C"), &top));
    EXPECT_TRUE(isError(top, 63, message));
    EXPECT_FALSE(fm.standardizeACLsForSystemContainerAtURL(url("C"), &tree));
    EXPECT_TRUE(isError(tree, 63, message));
  }
  // Nothing was set or changed while a template could not be built.
  EXPECT_TRUE(service->appliedACLs().empty());
  EXPECT_TRUE(service->modeChanges().empty());
}

TEST_F(SystemContainerACLsTest, FailuresOnSingleItemsAreLoggedAndTheWalkGoesOn) {
  auto service = use<platform::FakeExtendedACL>();
  makeContainer("C");
  service->failStep("acl_set_file", EPERM, "Preferences");
  service->failStep("chmod", EPERM, "/C/tmp");
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(url("C"), nullptr));
  const std::string eperm = std::strerror(EPERM);
  EXPECT_TRUE(fakes.logging->contains(
      "standardizeACLsAtURL",
      "Failed to set ACL on dir " + path("C/Library/Preferences") + ": " + eperm));
  EXPECT_TRUE(fakes.logging->contains("standardizeACLsAtURL",
                                      "Could not chmod " + path("C/tmp") + ": " + eperm));
  // Everything else got its list.
  const std::map<std::string, AccessControlList> expected{
      {path("C"), kTopLevel}, {path("C/Library"), kDirectory}, {path("C/tmp"), kDirectory}};
  EXPECT_EQ(service->appliedACLs(), expected);
  // Failing on the top directory is logged with its own message.
  service->clearFailures();
  service->failStep("acl_set_file", EPERM, "C");
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(url("C"), nullptr));
  EXPECT_TRUE(fakes.logging->contains(
      "standardizeACLsAtURL", "Failed to set top level ACL on dir " + path("C") + ": " + eperm));
}

TEST_F(SystemContainerACLsTest, EveryContainerOfAClassDirectory) {
  auto service = use<platform::FakeExtendedACL>();
  // A class directory that does not exist: success, and not a word.
  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(url("Data/System"), nullptr));
  EXPECT_TRUE(fakes.logging->lines().empty());
  makeContainer("Data/System/A");
  makeContainer("Data/System/B");
  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(url("Data/System"), nullptr));
  EXPECT_EQ(service->aclAt(path("Data/System/A")), kTopLevel);
  EXPECT_EQ(service->aclAt(path("Data/System/B/tmp")), kDirectory);

  // The first container cannot get its templates; the second is still done.
  fakes.logging->clear();
  service = use<platform::FakeExtendedACL>();
  service->failStep("acl_init", ENOMEM, "", 1);
  KSTErrorRef error;
  EXPECT_FALSE(fm.standardizeAllSystemContainerACLsAtURL(url("Data/System"), &error));
  EXPECT_TRUE(isError(error, 63, std::string("acl_init() failed: ") + std::strerror(ENOMEM)));
  EXPECT_EQ(service->aclAt(path("Data/System/A")).has_value() +
                service->aclAt(path("Data/System/B")).has_value(),
            1);
  EXPECT_EQ(fakes.countLogged("Failed to set system container ACL at ", testing::Match::Prefix),
            1u);
}

}  // namespace
}  // namespace kestrel
