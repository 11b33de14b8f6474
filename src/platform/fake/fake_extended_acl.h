// Extended ACLs for tests: lists are kept in memory by path instead of on the
// items, mode changes are recorded instead of made, and any step can be made
// to fail. The building steps are named after the calls they stand for:
// "acl_init", "acl_create_entry", "acl_get_permset", "acl_add_perm",
// "acl_set_permset", "acl_get_flagset_np", "acl_add_flag_np",
// "acl_set_flagset_np", "acl_set_tag_type", "acl_set_qualifier"; the platform
// steps are "lookup_group_uuid", "acl_set_file" and "chmod".
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/accounts.h"
#include "platform/extended_acl.h"

namespace kestrel::platform {

class FakeExtendedACL final : public ExtendedACL {
 public:
  // Groups are looked up by name in the accounts and get the same membership
  // UUIDs as on Linux.
  explicit FakeExtendedACL(std::shared_ptr<const Accounts> accounts);

  // From now on the named step fails with errnum (0 makes it succeed again):
  // every time, or only the next `times` times. With a path part, only
  // "acl_set_file" and "chmod" calls on paths that contain it fail.
  void failStep(const std::string& step, int errnum, const std::string& pathPart = "",
                int times = -1);
  void clearFailures();

  // The list set on each path (lists set empty are removed), and every mode
  // change asked for, in order.
  std::map<std::string, AccessControlList> appliedACLs() const;
  std::optional<AccessControlList> aclAt(const std::string& path) const;
  std::vector<std::pair<std::string, mode_t>> modeChanges() const;

  int init(int count, AccessControlList* acl) override;
  int createEntry(AccessControlList* acl, ACLEntryIndex* entry) override;
  int getPermset(const AccessControlList& acl, ACLEntryIndex entry,
                 std::uint32_t* permset) override;
  int addPerm(std::uint32_t* permset, std::uint32_t perm) override;
  int setPermset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t permset) override;
  int getFlagset(const AccessControlList& acl, ACLEntryIndex entry,
                 std::uint32_t* flagset) override;
  int addFlag(std::uint32_t* flagset, std::uint32_t flag) override;
  int setFlagset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t flagset) override;
  int setTagType(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t tag) override;
  int setQualifier(AccessControlList* acl, ACLEntryIndex entry, const Uuid& qualifier) override;

  // Like Linux, a missing item is ENOENT and a symbolic link ELOOP
  // (EOPNOTSUPP for a mode change).
  int lookupGroupUUID(std::string_view groupName, Uuid* uuid) const override;
  int setFile(const char* path, int type, const AccessControlList& acl) override;
  int getFile(const char* path, int type, AccessControlList* acl) const override;
  int setModeKeepingACL(const char* path, mode_t mode) override;
  // By the path the descriptor's item has now.
  int setDescriptor(int fd, int type, const AccessControlList& acl) override;
  int setModeKeepingACLDescriptor(int fd, mode_t mode) override;

 private:
  struct Failure {
    int errnum = 0;
    std::string pathPart;
    int remaining = -1;  // -1: every time
  };
  // The errno the step is to fail with for the path, or 0.
  int failure(const std::string& step, const char* path = nullptr) const;

  const std::shared_ptr<const Accounts> accounts_;
  mutable std::mutex mutex_;
  mutable std::map<std::string, Failure> failures_;
  std::map<std::string, AccessControlList> applied_;
  std::vector<std::pair<std::string, mode_t>> modeChanges_;
};

}  // namespace kestrel::platform
