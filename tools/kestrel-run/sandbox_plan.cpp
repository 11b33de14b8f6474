#include "sandbox_plan.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "upcall/upcall_items.h"

namespace kestrel::run {

namespace {

std::string joined(const std::vector<gid_t>& groups) {
  std::string text;
  for (const gid_t group : groups) text += (text.empty() ? "" : ",") + std::to_string(group);
  return text;
}

}  // namespace

std::optional<SandboxPlan> planFromReply(const kestrelctl::DecodedUpcallReply& reply,
                                         const AccountLookup* ahead, std::string* error) {
  if (reply.returnCode != 0) {
    *error = "the daemon answered return code " + std::to_string(reply.returnCode) + " (" +
             kestrelctl::upcallReturnCodeText(reply.returnCode) + ")";
    return std::nullopt;
  }
  SandboxPlan plan;
  std::optional<std::uint32_t> status;
  for (const auto& item : reply.items) {
    if (item.valueType == kKSTUpcallReplyStatus && item.number) status = item.number;
    if (!item.text) continue;
    switch (item.valueType) {
      case kKSTUpcallReplyDataContainer:
        plan.dataContainer = *item.text;
        break;
      case kKSTUpcallReplyTemporaryDirectory:
        plan.temporaryDirectory = *item.text;
        break;
      case kKSTUpcallReplyGroupContainer:
      case kKSTUpcallReplySystemGroupContainer:
      case kKSTUpcallReplySystemContainer:
        plan.sharedContainers.push_back(*item.text);
        break;
      default:
        break;
    }
  }
  if (status != 1u) {
    *error = "the daemon could not make or find every container asked for (status " +
             (status ? std::to_string(*status) : std::string("missing")) + ")";
    return std::nullopt;
  }
  if (plan.dataContainer.empty()) {
    *error = "the reply names no data container";
    return std::nullopt;
  }
  struct stat owner {};
  if (::stat(plan.dataContainer.c_str(), &owner) != 0) {
    *error = plan.dataContainer + ": " + std::strerror(errno);
    return std::nullopt;
  }
  plan.uid = owner.st_uid;
  plan.gid = owner.st_gid;
  const std::optional<Account> account =
      ahead != nullptr && ahead->uid == plan.uid ? ahead->account : accountOf(plan.uid);
  if (account) plan.supplementaryGroups = groupsOf(*account, plan.gid);
  if (plan.temporaryDirectory.empty()) plan.temporaryDirectory = plan.dataContainer + "/tmp";
  return plan;
}

std::vector<std::string> bwrapCommand(const SandboxPlan& plan, const LaunchOptions& options,
                                      const std::vector<std::string>& program) {
  std::string hidden = options.root;
  while (hidden.size() > 1 && hidden.back() == '/') hidden.pop_back();
  hidden = (hidden == "/" ? "" : hidden) + "/private/var";
  std::vector<std::string> command = {
      options.bwrap, "--ro-bind", "/", "/", "--dev", "/dev", "--proc", "/proc",  //
      "--perms", "01777", "--tmpfs", "/tmp", "--perms", "0755", "--tmpfs", "/run",
      // Every container of every user and app lies beneath it: it is replaced
      // by an empty directory, made read-only once the plan's are bound in.
      "--perms", "0755", "--tmpfs", hidden};
  // bwrap would make the directories above a mount point for root alone: they
  // are made first, open to all like the ones they stand for.
  const auto bind = [&](const std::string& path) {
    for (std::size_t slash = path.find('/', hidden.size() + 1); slash != std::string::npos;
         slash = path.find('/', slash + 1)) {
      command.insert(command.end(), {"--perms", "0755", "--dir", path.substr(0, slash)});
    }
    command.insert(command.end(), {"--bind", path, path});
  };
  bind(plan.dataContainer);
  for (const std::string& path : plan.sharedContainers) bind(path);
  command.insert(command.end(),
                 {"--remount-ro", hidden, "--unshare-pid", "--unshare-ipc", "--unshare-uts",
                  "--unshare-cgroup-try", "--die-with-parent", "--new-session", "--setenv", "HOME",
                  plan.dataContainer, "--setenv", "TMPDIR", plan.temporaryDirectory, "--chdir",
                  plan.dataContainer});
  if (!options.network) command.push_back("--unshare-net");
  command.insert(command.end(),
                 {"--", options.setpriv, "--reuid=" + std::to_string(plan.uid),
                  "--regid=" + std::to_string(plan.gid),
                  plan.supplementaryGroups.empty() ? "--clear-groups"
                                                   : "--groups=" + joined(plan.supplementaryGroups),
                  "--inh-caps=-all", "--bounding-set=-all", "--no-new-privs", "--"});
  command.insert(command.end(), program.begin(), program.end());
  return command;
}

}  // namespace kestrel::run
