#include <gtest/gtest.h>
#include <pwd.h>

#include <filesystem>
#include <optional>
#include <string>

#include "platform/linux/accounts_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using testing::ScratchRoot;

TEST(AccountsTest, AScratchRootsAccountsComeFromItsOwnFilesOnly) {
  ScratchRoot scratch;
  LinuxAccounts accounts(scratch.root());
  struct Row {
    std::string name;
    uid_t uid;
    std::string home;  // system path; empty for "no such user"
  };
  const Row rows[] = {
      {"root", 0, "/private/var/root"},
      {"_installd", 33, "/private/var/tesseld"},
      {"mobile", 501, "/private/var/mobile"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    for (const auto& user : {accounts.userByName(row.name), accounts.userById(row.uid)}) {
      ASSERT_TRUE(user.has_value());
      EXPECT_EQ(user->name, row.name);
      EXPECT_EQ(user->uid, row.uid);
      EXPECT_EQ(user->gid, row.uid);
      EXPECT_EQ(user->homeDirectory, scratch.resolve(row.home));
    }
  }
  EXPECT_FALSE(accounts.userByName(std::string("mobile\0x", 8)).has_value());
  EXPECT_FALSE(accounts.userById(12345).has_value());
  ASSERT_TRUE(accounts.groupByName("systemusers").has_value());
  EXPECT_EQ(accounts.groupByName("systemusers")->gid, 499U);
  EXPECT_EQ(accounts.groupById(499)->name, "systemusers");

  // Malformed lines are skipped, the first match wins and long entries are read.
  std::string members;
  for (int i = 0; i < 500; ++i) members += (i ? ",member" : "member") + std::to_string(i);
  scratch.writeFile("/etc/passwd",
                    "this line is not an entry\n"
                    "first:x:600:600::/home/first:/bin/sh\n"
                    "second:x:600:600::/home/second:/bin/sh\n"
                    "homeless:x:601:601:::/bin/sh\n");
  scratch.writeFile("/etc/group", "crowd:x:700:" + members + "\nafter:x:701:\n");

  ASSERT_TRUE(accounts.userById(600).has_value());
  EXPECT_EQ(accounts.userById(600)->name, "first");
  ASSERT_TRUE(accounts.userByName("second").has_value());
  EXPECT_EQ(accounts.userByName("second")->homeDirectory, scratch.resolve("/home/second"));
  ASSERT_TRUE(accounts.userByName("homeless").has_value());
  EXPECT_EQ(accounts.userByName("homeless")->homeDirectory, "");
  // The member list outgrows the first buffer; the entries after it must still be found.
  ASSERT_TRUE(accounts.groupByName("crowd").has_value());
  EXPECT_EQ(accounts.groupByName("crowd")->gid, 700U);
  ASSERT_TRUE(accounts.groupById(701).has_value());
  EXPECT_EQ(accounts.groupById(701)->name, "after");

  // Without account files a scratch root never falls back to the host's.
  std::filesystem::remove(scratch.resolve("/etc/passwd"));
  std::filesystem::remove(scratch.resolve("/etc/group"));
  EXPECT_FALSE(accounts.userByName("root").has_value());
  EXPECT_FALSE(accounts.userById(0).has_value());
  EXPECT_FALSE(accounts.groupByName("root").has_value());
  EXPECT_FALSE(accounts.groupById(0).has_value());
}

TEST(AccountsTest, TheHostRootUsesTheHostDatabase) {
  LinuxAccounts accounts(FilesystemRoot("/"));
  const passwd* expected = ::getpwuid(0);
  ASSERT_NE(expected, nullptr);
  const auto user = accounts.userById(0);
  ASSERT_TRUE(user.has_value());
  EXPECT_EQ(user->name, expected->pw_name);
  EXPECT_EQ(user->homeDirectory, expected->pw_dir);
  ASSERT_TRUE(accounts.userByName(user->name).has_value());
  EXPECT_EQ(accounts.userByName(user->name)->uid, 0U);
  EXPECT_FALSE(accounts.userByName("kestrel-no-such-user").has_value());
}

}  // namespace
}  // namespace kestrel::platform
