#include "platform/extended_acl.h"

#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "platform/fake/fake_platform.h"
#include "platform/linux/extended_acl_linux.h"
#include "support/scratch_root.h"
#include "support/store_test_helpers.h"

namespace kestrel::platform {
namespace {

namespace fs = std::filesystem;

AccessControlEntry allow(gid_t gid, std::uint32_t permissions, std::uint32_t flags) {
  return {kACLTagExtendedAllow, permissions, flags, groupMembershipUUID(gid)};
}

using testing::aclText;
using testing::modeOf;

TEST(ExtendedACLTest, MembershipUUIDIsDerivedFromTheGid) {
  EXPECT_EQ(groupMembershipUUID(499).string(), "4B535447-0000-8000-8000-0000000001F3");
  for (const gid_t gid : {0U, 499U, 4294967294U}) {
    EXPECT_EQ(gidOfGroupMembershipUUID(groupMembershipUUID(gid)), gid);
  }
  EXPECT_EQ(gidOfGroupMembershipUUID(*Uuid::parse("4B535447-0000-8000-8001-0000000001F3")),
            std::nullopt);
  EXPECT_EQ(gidOfGroupMembershipUUID(Uuid()), std::nullopt);
}

TEST(ExtendedACLTest, RecordRoundTripsAndRejectsAnythingElse) {
  const AccessControlList acl{{allow(499, 0x3FFE, 0x160),
                               allow(499, 0x624, 0),
                               {kACLTagExtendedDeny, 0x2, 0x10, groupMembershipUUID(7)}}};
  const std::string text = encodeAccessControlList(acl);
  EXPECT_EQ(text,
            "kestrel-acl 1\n"
            "allow 4B535447-0000-8000-8000-0000000001F3 0x3ffe 0x160\n"
            "allow 4B535447-0000-8000-8000-0000000001F3 0x624 0x0\n"
            "deny 4B535447-0000-8000-8000-000000000007 0x2 0x10\n");
  EXPECT_EQ(decodeAccessControlList(text), acl);
  EXPECT_EQ(decodeAccessControlList("kestrel-acl 1\n"), AccessControlList{});
  for (const char* bad : {"", "kestrel-acl 2\n",
                          "kestrel-acl 1\nallow 4B535447-0000-8000-8000-0000000001F3 0x3ffe 0x160",
                          "kestrel-acl 1\npermit 4B535447-0000-8000-8000-0000000001F3 0x1 0x0\n"}) {
    SCOPED_TRACE(bad);
    EXPECT_EQ(decodeAccessControlList(bad), std::nullopt);
  }
}

TEST(ExtendedACLTest, BuildingStepsCheckTheirArguments) {
  LinuxExtendedACL service(nullptr);
  AccessControlList acl;
  EXPECT_EQ(service.init(-1, &acl), EINVAL);
  EXPECT_EQ(service.init(129, &acl), ENOMEM);
  ASSERT_EQ(service.init(1, &acl), 0);
  std::uint32_t bits = 0;
  EXPECT_EQ(service.getPermset(acl, 0, &bits), EINVAL);  // no entry yet
  ACLEntryIndex entry = 9;
  ASSERT_EQ(service.createEntry(&acl, &entry), 0);
  EXPECT_EQ(entry, 0u);
  EXPECT_EQ(service.addPerm(&bits, 0x4000), EINVAL);
  EXPECT_EQ(service.addFlag(&bits, 0x80), EINVAL);
  EXPECT_EQ(service.setTagType(&acl, 1, kACLTagExtendedAllow), EINVAL);
  EXPECT_EQ(service.lookupGroupUUID("systemusers", &acl.entries[0].qualifier), ENOSYS);
}

class LinuxExtendedACLTest : public ::testing::Test {
 protected:
  std::string path(const std::string& relative) const { return scratch.path() + "/" + relative; }
  int set(const std::string& relative, const AccessControlList& acl) {
    return service.setFile(path(relative).c_str(), kACLTypeExtended, acl);
  }

  testing::ScratchRoot scratch;
  LinuxExtendedACL service{std::make_shared<FakeAccounts>(scratch.root())};
};

TEST_F(LinuxExtendedACLTest, MapsEntriesOntoPosixListsAndKeepsTheRecord) {
  fs::create_directories(path("d"));
  ::chmod(path("d").c_str(), 0750);
  fs::create_directories(path("open"));
  ::chmod(path("open").c_str(), 0755);
  std::ofstream(path("f")) << "x";
  ::chmod(path("f").c_str(), 0640);
  struct Row {
    const char* item;
    AccessControlList acl;
    const char* access;
    const char* defaults;
    bool sticky;
  };
  const Row rows[] = {
      // Read and search only; the default list is removed.
      {"d",
       {{allow(499, 0xA, 0)}},
       "user::rwx,group::r-x,group:499:r-x,mask::r-x,other::---",
       "",
       false},
      // Adding without delete child: list, search and add, and the sticky bit;
      // inherit-only reaches only new items.
      {"d",
       {{allow(499, 0x3FFE, 0x160), allow(499, 0x624, 0)}},
       "user::rwx,group::r-x,group:499:rwx,mask::rwx,other::---",
       "user::rwx,group::---,group:499:rwx,mask::rwx,other::---",
       true},
      // Two groups; a file-only inheritance maps as for a file.
      {"d",
       {{allow(499, 0x3FFE, 0x60), allow(501, 0x20, 0x20)}},
       "user::rwx,group::r-x,group:499:rwx,group:501:rwx,mask::rwx,other::---",
       "user::rwx,group::---,group:499:rwx,group:501:-w-,mask::rwx,other::---",
       true},
      // Full control again: no sticky bit.
      {"d",
       {{allow(499, 0x3FFE, 0)}},
       "user::rwx,group::r-x,group:499:rwx,mask::rwx,other::---",
       "",
       false},
      // A member never gets less than everyone else.
      {"open",
       {{allow(499, 0x2, 0)}},
       "user::rwx,group::r-x,group:499:r-x,mask::r-x,other::r-x",
       "",
       false},
      // Files have no default list; delete child means nothing on a file.
      {"f",
       {{allow(499, 0x3FBE, 0x10)}},
       "user::rw-,group::r--,group:499:rwx,mask::rwx,other::---",
       nullptr,
       false},
      // An empty list leaves only the mode, and no record.
      {"f", {}, "user::rw-,group::r--,other::---", nullptr, false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(row.item) + " " + encodeAccessControlList(row.acl));
    ASSERT_EQ(set(row.item, row.acl), 0);
    EXPECT_EQ(aclText(path(row.item), ACL_TYPE_ACCESS), row.access);
    if (row.defaults != nullptr) {
      EXPECT_EQ(aclText(path(row.item), ACL_TYPE_DEFAULT), row.defaults);
    }
    EXPECT_EQ((modeOf(path(row.item)) & S_ISVTX) != 0, row.sticky);
    AccessControlList read;
    if (row.acl.entries.empty()) {
      EXPECT_EQ(service.getFile(path(row.item).c_str(), kACLTypeExtended, &read), ENOENT);
    } else {
      ASSERT_EQ(service.getFile(path(row.item).c_str(), kACLTypeExtended, &read), 0);
      EXPECT_EQ(read, row.acl);
    }
  }
  // A mode change keeps the sticky bit that the record needs.
  ASSERT_EQ(set("d", {{allow(499, 0x624, 0)}}), 0);
  ASSERT_EQ(service.setModeKeepingACL(path("d").c_str(), 0700), 0);
  EXPECT_EQ(modeOf(path("d")), 01770u);
}

TEST_F(LinuxExtendedACLTest, ModeChangeKeepsTheGrant) {
  std::ofstream(path("f")) << "x";
  std::ofstream(path("plain")) << "x";
  ASSERT_EQ(set("f", {{allow(499, 0x3FBE, 0x10)}}), 0);
  ASSERT_EQ(service.setModeKeepingACL(path("f").c_str(), 0), 0);
  EXPECT_EQ(aclText(path("f"), ACL_TYPE_ACCESS),
            "user::---,group::---,group:499:rwx,mask::rwx,other::---");
  ASSERT_EQ(service.setModeKeepingACL(path("f").c_str(), 04640), 0);
  struct stat st {};
  ASSERT_EQ(::stat(path("f").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 04670u);  // the group bits are the mask
  EXPECT_EQ(aclText(path("f"), ACL_TYPE_ACCESS),
            "user::rw-,group::r--,group:499:rwx,mask::rwx,other::---");

  ASSERT_EQ(service.setModeKeepingACL(path("plain").c_str(), 0), 0);
  ASSERT_EQ(::stat(path("plain").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0u);
}

TEST_F(LinuxExtendedACLTest, RefusesWhatTheKernelCannotHoldAndNeverFollowsLinks) {
  std::ofstream(path("target")) << "x";
  ::chmod(path("target").c_str(), 0644);
  fs::create_symlink(path("target"), path("link"));
  struct Row {
    const char* item;
    int type;
    AccessControlList acl;
    int expected;
  };
  const Row rows[] = {
      {"link", kACLTypeExtended, {{allow(499, 0x2, 0)}}, ELOOP},
      {"missing", kACLTypeExtended, {{allow(499, 0x2, 0)}}, ENOENT},
      {"target", 0, {{allow(499, 0x2, 0)}}, EINVAL},
      {"target",
       kACLTypeExtended,
       {{{kACLTagExtendedDeny, 0x2, 0, groupMembershipUUID(499)}}},
       EOPNOTSUPP},
      {"target", kACLTypeExtended, {{{kACLTagExtendedAllow, 0x2, 0, Uuid::random()}}}, EINVAL},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.item);
    EXPECT_EQ(service.setFile(path(row.item).c_str(), row.type, row.acl), row.expected);
  }
  EXPECT_EQ(service.setModeKeepingACL(path("link").c_str(), 0), EOPNOTSUPP);
  // Nothing reached the file.
  EXPECT_EQ(aclText(path("target"), ACL_TYPE_ACCESS), "user::rw-,group::r--,other::r--");
  EXPECT_LT(::getxattr(path("target").c_str(), kExtendedACLAttribute, nullptr, 0), 0);
  struct stat st {};
  ASSERT_EQ(::stat(path("target").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
}

}  // namespace
}  // namespace kestrel::platform
