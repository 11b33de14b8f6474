// Who is at the other end of a connection, taken once when it was accepted:
// the kernel's SO_PEERCRED, a pidfd (so that a reused pid is never taken for
// the peer), the LSM label recorded at connect where the system has an LSM,
// and the executable read through the pidfd right at accept.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/unique_fd.h"

namespace kestrel::platform {

struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;  // effective user id
  gid_t gid = 0;
  std::shared_ptr<UniqueFd> pidfd;            // absent when pidfd_open failed
  std::optional<std::string> securityLabel;   // SO_PEERSEC, when an LSM recorded one
  std::optional<std::string> executablePath;  // /proc/<pid>/exe at accept, when readable
  // That file's owner and mode when the peer connected, read from the file the
  // peer ran (not from whatever lies at its path later). Only root can change
  // the owner or mode of a root-owned file, so what was trusted at connect
  // stays trusted for the life of the connection without a look per request.
  std::optional<struct stat> executableStatus;
};

// Reads the credentials of the peer of a connected Unix socket.
PeerCredentials readPeerCredentials(int socketFd);

// The same for a running process, found by its pid (its label is the one in
// /proc/<pid>/attr/current). Without a pidfd when the process is gone; uid
// and gid are -1 when they could not be read.
PeerCredentials readProcessCredentials(pid_t pid);

}  // namespace kestrel::platform
