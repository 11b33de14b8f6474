// The account database, with getpwnam/getpwuid/getgrnam semantics. On the host
// root it is the host's database; beneath any other root it is <root>/etc/passwd
// and <root>/etc/group, and home directories are taken beneath the root.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

namespace kestrel::platform {

struct UserAccount {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
  std::string homeDirectory;  // already resolved beneath the filesystem root
};

struct GroupAccount {
  std::string name;
  gid_t gid = 0;
};

class Accounts {
 public:
  virtual ~Accounts() = default;
  virtual std::optional<UserAccount> userByName(std::string_view name) const = 0;
  virtual std::optional<UserAccount> userById(uid_t uid) const = 0;
  virtual std::optional<GroupAccount> groupByName(std::string_view name) const = 0;
  virtual std::optional<GroupAccount> groupById(gid_t gid) const = 0;
};

}  // namespace kestrel::platform
