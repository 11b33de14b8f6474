// The groups a program started as a user belongs to, as getgrouplist gives
// them: the group it starts with, then every group naming the user as a
// member. /etc/passwd and /etc/group answer for the users they know, read
// here directly; the system's account database (NSS, and whatever modules it
// loads: half a millisecond) only for the others. So a user of the files
// gets no memberships that another source of the database would add.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace kestrel::run {

struct Account {
  std::string name;
  bool inFiles = false;  // found in the passwd file, not through NSS
};

struct AccountFiles {
  std::string passwd = "/etc/passwd";
  std::string group = "/etc/group";
};

// The user's account from the files, else from NSS; nothing when neither
// knows it.
std::optional<Account> accountOf(uid_t uid, const AccountFiles& files = {});

// An account looked up ahead of need, with the uid it was looked up for.
struct AccountLookup {
  uid_t uid = 0;
  std::optional<Account> account;
};

// `gid` first, then every other group naming the account as a member: from
// the group file for an account of the files, from NSS for the others.
std::vector<gid_t> groupsOf(const Account& account, gid_t gid, const AccountFiles& files = {});

}  // namespace kestrel::run
