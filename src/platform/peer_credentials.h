// Who is at the other end of a connection, taken once when it was accepted:
// the kernel's SO_PEERCRED, a pidfd (so that a reused pid is never taken for
// the peer), the LSM label recorded at connect where the system has an LSM,
// and the executable read through the pidfd right at accept.
#pragma once

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
  // That file itself (O_PATH), so that it can be examined without a path walk
  // and is the binary the peer ran when it connected.
  std::shared_ptr<UniqueFd> executable;
};

// Reads the credentials of the peer of a connected Unix socket.
PeerCredentials readPeerCredentials(int socketFd);

}  // namespace kestrel::platform
