// What kestrel-run starts: the containers the daemon named for a process,
// turned into the bubblewrap command line that confines it to them.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "kestrel-run/user_groups.h"
#include "kestrelctl/upcall_command.h"

namespace kestrel::run {

struct SandboxPlan {
  std::string dataContainer;                  // HOME, read-write
  std::string temporaryDirectory;             // TMPDIR, inside the data container
  std::vector<std::string> sharedContainers;  // groups, system groups, the system container
  uid_t uid = 0;                              // the data container's owner: the program runs as it
  gid_t gid = 0;
  std::vector<gid_t> supplementaryGroups;
};

// The plan for a reply, or nothing with the reason: a return code other than
// 0, a status other than 1, no data container, or one that cannot be looked at.
// The groups are those of the data container's owner (none for a user no
// account database knows), starting with the container's group; `ahead`, when
// given, is that owner's account if it was looked up already.
std::optional<SandboxPlan> planFromReply(const kestrelctl::DecodedUpcallReply& reply,
                                         const AccountLookup* ahead, std::string* error);

struct LaunchOptions {
  std::string root = "/";  // the daemon's root: its private/var is hidden
  bool network = false;
  std::string bwrap = "bwrap";
  std::string setpriv = "setpriv";
};

// bwrap's whole command line, program included: the system read-only, a
// private /tmp, /run, /dev and /proc, the root's private/var replaced by an
// empty read-only directory into which only the plan's containers are bound
// read-write, every namespace but the network's unshared (that too without
// `network`), HOME and TMPDIR set, and the program started by setpriv as the
// container's user with no capabilities and no new privileges.
std::vector<std::string> bwrapCommand(const SandboxPlan& plan, const LaunchOptions& options,
                                      const std::vector<std::string>& program);

}  // namespace kestrel::run
