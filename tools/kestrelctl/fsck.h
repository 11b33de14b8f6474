// A consistency check of the container store beneath a root, for operators,
// the load test and the crash test: every entry of every class directory must
// be a valid container, no identifier may have two live containers of one
// class, and (when the daemon is asked too) its cache must list exactly what
// is on disk.
//
// Staging and replace journals: a running daemon leaves neither once it is
// idle, so with the daemon each is a problem. Without it (offline, after a
// crash) they are what the next start finishes: each is reported as pending,
// with what the start will do; a journal that start could not recover from
// is a problem either way.
//
// Uses the daemon's own layout and metadata and journal readers, so the
// platform services for the root must be installed first. Run it while the
// daemon is idle: a creation or replace in flight legitimately has a
// directory in staging.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "store/container_class.h"

namespace kestrel::kestrelctl {

// What the daemon lists for (user, class, transient): identifier and UUID
// pairs, or nothing when it could not be asked (the reason in *error).
using ListContainers = std::function<std::optional<std::set<std::pair<std::string, std::string>>>(
    std::uint32_t user, KSTContainerClass containerClass, bool transient, std::string* error)>;

struct FsckReport {
  std::size_t containers = 0;         // valid containers found on disk
  std::size_t classDirectories = 0;   // class directories looked at
  std::vector<std::string> problems;  // one line each; empty when all is well
  std::vector<std::string> pending;   // offline: what the next start will finish
};

// Checks every class directory of the users the store knows: 33 for bundles,
// 499 for system containers, every valid mobile user for the rest, live and
// transient. With listContainers, compares each class with the daemon's view.
FsckReport checkContainerStore(const ListContainers& listContainers);

}  // namespace kestrel::kestrelctl
