// A code-signing identity for tests: answers are set up per process id or per
// executable path, and every lookup can be made to fail.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "platform/code_signing_identity.h"

namespace kestrel::platform {

class FakeCodeSigningIdentity final : public CodeSigningIdentity {
 public:
  // The answer for a peer with this pid (checked first) or this executable path.
  void setIdentityForPid(pid_t pid, CodeSigningIdentityResult result);
  void setIdentityForExecutable(const std::string& path, CodeSigningIdentityResult result);
  // Shorthand for a peer that has an identifier and, optionally, entitlements.
  void setIdentityForPid(pid_t pid, const std::string& signingIdentifier,
                         std::optional<PlistDictionary> entitlements);
  void removeIdentityForPid(pid_t pid);
  void removeIdentityForExecutable(const std::string& path);

  // While set, every identify() answers with no identifier, no entitlements and
  // this error; nullopt answers normally again.
  void setError(std::optional<std::string> error);

  // The set-up answer; a peer with none gets no identifier, no entitlements and
  // the error "no registered identity for <exe>" (or "for pid <pid>").
  CodeSigningIdentityResult identify(const PeerCredentials& peer) override;
  // How many times identify() was called.
  std::size_t identifyCount() const;

 private:
  mutable std::mutex mutex_;
  std::map<pid_t, CodeSigningIdentityResult> byPid_;
  std::map<std::string, CodeSigningIdentityResult> byExecutable_;
  std::optional<std::string> error_;
  std::size_t identifyCount_ = 0;
};

}  // namespace kestrel::platform
