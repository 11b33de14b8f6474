// The code-signing identity of a peer on Linux, looked up in the registry of
// identities: every "*.plist" file in <root>/etc/kestrel/signatures/. Each file
// is a property-list dictionary (any format) with
//   "SigningIdentifier"  string, required;
//   "Entitlements"       dictionary, optional (absent: the peer has none);
// and exactly one of
//   "Label"              an LSM security label, matched against the label the
//                        kernel recorded when the peer connected;
//   "Executable"         the absolute, canonical path of the client binary as
//                        /proc/<pid>/exe shows it. It is the path on this
//                        machine, not a path beneath the daemon's root: with a
//                        scratch root, the registry names the real location of
//                        the binary inside the scratch directory.
//
// A peer with a security label is identified by its label only; a peer without
// one by its executable. Trust: the signatures directory and every registry file
// must be owned by root and not writable by group or others (a file that is not
// is ignored; a directory that is not makes nothing trusted), and a matched
// executable must be a regular file owned by root and not writable by group or
// others. docs/security.md describes what this identity can and cannot tell.
//
// The registry is cached and read again whenever the directory, one of its
// files or a directory on the way to it changes, which an inotify watch tells
// with one non-blocking read per identify(). Where the watch cannot be placed,
// every identify() compares the directory and its files with what was read
// (inode, owner, mode, size, modification and change time). identify() may be
// called from any number of threads at once.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "platform/code_signing_identity.h"
#include "platform/linux/directory_watch_linux.h"
#include "platform/root.h"

namespace kestrel::platform {

class LinuxCodeSigningIdentity final : public CodeSigningIdentity {
 public:
  explicit LinuxCodeSigningIdentity(FilesystemRoot root);
  ~LinuxCodeSigningIdentity() override;
  LinuxCodeSigningIdentity(const LinuxCodeSigningIdentity&) = delete;
  LinuxCodeSigningIdentity& operator=(const LinuxCodeSigningIdentity&) = delete;

  // Without an identifier, error says why: no registry entry matches, the match
  // is ambiguous, the executable or the registry is not trusted (ignored registry
  // files are named with their reason).
  CodeSigningIdentityResult identify(const PeerCredentials& peer) override;

  // The directory the registry is read from.
  const std::string& registryDirectory() const { return directory_; }

 private:
  struct Registry;

  // The registry as it is on disk now, read again if it changed.
  std::shared_ptr<const Registry> currentRegistry();

  // The registry to use now, or nullptr when it must be read again. Under mutex_.
  std::shared_ptr<const Registry> usableRegistryLocked();

  const std::string directory_;
  // Lock order: reloadMutex_, then mutex_.
  std::mutex reloadMutex_;  // one reload at a time
  std::mutex mutex_;        // guards what follows
  std::shared_ptr<const Registry> registry_;
  DirectoryChangeWatch watch_;
  bool watched_ = false;       // the watch covers the registry as read
  std::uint64_t changes_ = 0;  // changes the watch reported
};

}  // namespace kestrel::platform
