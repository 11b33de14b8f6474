// The peer of a Unix socket, read once right after accept.
//
// The pid of SO_PEERCRED is the one the peer had when it connected. A pidfd
// pins that process: SO_PEERPIDFD hands us one for exactly the peer (Linux
// 6.5 and later); on older kernels pidfd_open(pid) is the fallback, which
// cannot rule out a pid reused between connect and accept. The executable is
// opened through /proc/<pid>/exe; its path and its owner and mode (read
// from the opened file) are kept only if the pidfd's process is still alive
// afterwards, so none of them can belong to a process that took over the pid
// in the meantime.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <string>
#include <vector>

#include "platform/peer_credentials.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace kestrel::platform {

namespace {

UniqueFd peerPidfd(int socketFd, pid_t pid) {
  int fd = -1;
  socklen_t length = sizeof fd;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &fd, &length) == 0 && fd >= 0) {
    return UniqueFd(fd);
  }
  if (pid <= 0) return UniqueFd();
  return UniqueFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

bool pidfdAlive(int pidfd) {
  if (::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0) return true;
  return errno == EPERM;  // alive, only not ours to signal
}

std::optional<std::string> securityLabel(int socketFd) {
  std::vector<char> buffer(256);
  for (int attempt = 0; attempt < 4; ++attempt) {
    socklen_t length = static_cast<socklen_t>(buffer.size());
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERSEC, buffer.data(), &length) == 0) {
      std::string label(buffer.data(), std::min<std::size_t>(length, buffer.size()));
      while (!label.empty() && label.back() == '\0') label.pop_back();
      if (label.empty()) return std::nullopt;
      return label;
    }
    if (errno != ERANGE) return std::nullopt;  // ENOPROTOOPT: no LSM recorded a label
    buffer.resize(std::max<std::size_t>(length, buffer.size() * 2));
  }
  return std::nullopt;
}

// The file the process runs, opened (O_PATH) through /proc/<pid>/exe.
UniqueFd openExecutable(pid_t pid) {
  const std::string link = "/proc/" + std::to_string(pid) + "/exe";
  return UniqueFd(::open(link.c_str(), O_PATH | O_CLOEXEC));
}

// The path of an open file, as the kernel names it.
std::optional<std::string> pathOf(int fd) {
  const std::string link = "/proc/self/fd/" + std::to_string(fd);
  std::vector<char> buffer(4096);
  const ssize_t length = ::readlink(link.c_str(), buffer.data(), buffer.size());
  if (length <= 0 || static_cast<std::size_t>(length) >= buffer.size()) return std::nullopt;
  return std::string(buffer.data(), static_cast<std::size_t>(length));
}

// The label an LSM gave the process, as /proc shows it.
std::optional<std::string> processSecurityLabel(pid_t pid) {
  const UniqueFd fd(
      ::open(("/proc/" + std::to_string(pid) + "/attr/current").c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return std::nullopt;
  char buffer[256];
  const ssize_t length = ::read(fd.get(), buffer, sizeof buffer);
  if (length <= 0) return std::nullopt;  // EINVAL: no LSM keeps labels
  std::string label(buffer, static_cast<std::size_t>(length));
  while (!label.empty() && (label.back() == '\0' || label.back() == '\n')) label.pop_back();
  if (label.empty()) return std::nullopt;
  return label;
}

// The executable of the process and its status, kept only when the pidfd's
// process is still alive once they were read (so that they are not those
// of a process that took over the pid).
void readExecutable(pid_t pid, const UniqueFd& pidfd, PeerCredentials* peer) {
  if (pid <= 0) return;
  // The path is read from the opened file, so the two name the same file
  // even if the process executes another program meanwhile.
  UniqueFd executable = openExecutable(pid);
  auto path = executable ? pathOf(executable.get()) : std::nullopt;
  struct stat status {};
  if (path && ::fstat(executable.get(), &status) == 0 && pidfd && pidfdAlive(pidfd.get())) {
    peer->executablePath = std::move(path);
    peer->executableStatus = status;
  }
}

}  // namespace

PeerCredentials readProcessCredentials(pid_t pid) {
  PeerCredentials peer;
  peer.pid = pid;
  peer.uid = static_cast<uid_t>(-1);
  peer.gid = static_cast<gid_t>(-1);
  UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  if (!pidfd) return peer;
  struct stat owner {};
  if (::stat(("/proc/" + std::to_string(pid)).c_str(), &owner) == 0) {
    peer.uid = owner.st_uid;
    peer.gid = owner.st_gid;
  }
  peer.securityLabel = processSecurityLabel(pid);
  readExecutable(pid, pidfd, &peer);
  peer.pidfd = std::make_shared<UniqueFd>(std::move(pidfd));
  return peer;
}

PeerCredentials readPeerCredentials(int socketFd) {
  PeerCredentials peer;
  struct ucred cred = {};
  socklen_t length = sizeof cred;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0) {
    // Never leave the defaults (uid 0) for a peer we know nothing about.
    peer.uid = static_cast<uid_t>(-1);
    peer.gid = static_cast<gid_t>(-1);
    return peer;
  }
  peer.pid = cred.pid;
  peer.uid = cred.uid;
  peer.gid = cred.gid;
  peer.securityLabel = securityLabel(socketFd);

  UniqueFd pidfd = peerPidfd(socketFd, cred.pid);
  readExecutable(cred.pid, pidfd, &peer);
  if (pidfd) peer.pidfd = std::make_shared<UniqueFd>(std::move(pidfd));
  return peer;
}

}  // namespace kestrel::platform
