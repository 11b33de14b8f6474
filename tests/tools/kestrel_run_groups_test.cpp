// kestrel-run's groups of a container's owner, read from the account files
// without the system's account database.
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>

#include <fstream>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "kestrel-run/user_groups.h"
#include "support/scratch_root.h"

namespace kestrel::run {
namespace {

TEST(KestrelRunGroupsTest, FilesGiveTheOwnersGroupsAsGetgrouplistWould) {
  // What getgrouplist gives with these two files in place of the host's
  // (checked in a mount namespace), quirks included: memberships are read
  // from every line of the group file, comments too, numbers as strtoul
  // reads them, blanks skipped before a member's name but not after it.
  testing::ScratchRoot scratch;
  scratch.writeFile("/etc/passwd",
                    "# accounts\n"
                    "root:x:0:0:root:/root:/bin/sh\n"
                    "mob:x:500:500::/:/bin/sh\n"
                    "broken:x:50x:1::/:/bin/sh\n"
                    "  mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n"
                    "twin:x:501:77::/:/bin/sh\n"
                    "#hid:x:3999999:5::/:/bin/sh\n"
                    "sp:x: 506:5\n");
  scratch.writeFile("/etc/group",
                    "mobile:x:501:\n"
                    "staff:x:20:root, mobile ,mob\n"
                    "# wheel:x:0:mobile\n"
                    "short:x:30\n"
                    "audio:x:29:\tmobile\n"
                    "own:x:40:mob,mobile\r\n"
                    "video:x:44:mobiles,amobile\n"
                    "twice:x:45:mob,mob\n"
                    "again:x:45:mob\n"
                    "plus:x:+46:sp,\n"
                    "bad:x:47x:sp\n"
                    "rest:x:48:sp:extra\n");
  const AccountFiles files{scratch.resolve("/etc/passwd"), scratch.resolve("/etc/group")};

  struct Case {
    uid_t uid;
    gid_t gid;  // the container's group, first of the list
    std::optional<std::vector<gid_t>> groups;
  } cases[] = {
      {501, 501, std::vector<gid_t>{501, 0, 29}},
      {501, 29, std::vector<gid_t>{29, 0}},
      {500, 500, std::vector<gid_t>{500, 20, 40, 45, 45}},
      {0, 0, std::vector<gid_t>{0, 20}},
      {506, 5, std::vector<gid_t>{5, 46}},
      // Known to neither the files nor the system: no account, no groups.
      {3999999, 5, std::nullopt},
  };
  for (const Case& test : cases) {
    SCOPED_TRACE("uid " + std::to_string(test.uid) + ", gid " + std::to_string(test.gid));
    const std::optional<Account> account = accountOf(test.uid, files);
    ASSERT_EQ(account.has_value(), test.groups.has_value());
    if (account) {
      EXPECT_EQ(groupsOf(*account, test.gid, files), *test.groups);
    }
  }
}

TEST(KestrelRunGroupsTest, HostAccountsGetWhatTheSystemDatabaseGives) {
  // Every account of the host's own files, against getgrouplist through NSS.
  std::ifstream passwd("/etc/passwd");
  std::string line;
  int compared = 0;
  while (std::getline(passwd, line)) {
    std::istringstream fields(line);
    std::string name, password, uid;
    if (!std::getline(fields, name, ':') || !std::getline(fields, password, ':') ||
        !std::getline(fields, uid, ':')) {
      continue;
    }
    const struct passwd* entry = ::getpwnam(name.c_str());
    if (entry == nullptr || std::to_string(entry->pw_uid) != uid) continue;  // not the first
    const gid_t gid = entry->pw_gid;
    int count = 64;
    std::vector<gid_t> expected(count);
    while (::getgrouplist(name.c_str(), gid, expected.data(), &count) < 0) expected.resize(count);
    expected.resize(count);

    SCOPED_TRACE(name);
    const std::optional<Account> account = accountOf(entry->pw_uid);
    ASSERT_TRUE(account);
    EXPECT_TRUE(account->inFiles);
    EXPECT_EQ(account->name, name);
    EXPECT_EQ(groupsOf(*account, gid), expected);
    ++compared;
  }
  EXPECT_GT(compared, 0);
}

}  // namespace
}  // namespace kestrel::run
