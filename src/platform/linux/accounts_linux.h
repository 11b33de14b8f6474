// The account database on Linux: the host's NSS database on the host root, the
// root's own etc/passwd and etc/group files beneath any other root.
#pragma once

#include "platform/accounts.h"
#include "platform/root.h"

namespace kestrel::platform {

class LinuxAccounts final : public Accounts {
 public:
  explicit LinuxAccounts(FilesystemRoot root);

  std::optional<UserAccount> userByName(std::string_view name) const override;
  std::optional<UserAccount> userById(uid_t uid) const override;
  std::optional<GroupAccount> groupByName(std::string_view name) const override;
  std::optional<GroupAccount> groupById(gid_t gid) const override;

 private:
  FilesystemRoot root_;
};

}  // namespace kestrel::platform
