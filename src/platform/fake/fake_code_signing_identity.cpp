#include "platform/fake/fake_code_signing_identity.h"

#include <utility>

namespace kestrel::platform {

void FakeCodeSigningIdentity::setIdentityForPid(pid_t pid, CodeSigningIdentityResult result) {
  const std::lock_guard lock(mutex_);
  byPid_.insert_or_assign(pid, std::move(result));
}

void FakeCodeSigningIdentity::setIdentityForExecutable(const std::string& path,
                                                       CodeSigningIdentityResult result) {
  const std::lock_guard lock(mutex_);
  byExecutable_.insert_or_assign(path, std::move(result));
}

void FakeCodeSigningIdentity::setIdentityForPid(pid_t pid, const std::string& signingIdentifier,
                                                std::optional<PlistDictionary> entitlements) {
  setIdentityForPid(pid, CodeSigningIdentityResult{signingIdentifier, std::move(entitlements), {}});
}

void FakeCodeSigningIdentity::removeIdentityForPid(pid_t pid) {
  const std::lock_guard lock(mutex_);
  byPid_.erase(pid);
}

void FakeCodeSigningIdentity::removeIdentityForExecutable(const std::string& path) {
  const std::lock_guard lock(mutex_);
  byExecutable_.erase(path);
}

void FakeCodeSigningIdentity::setError(std::optional<std::string> error) {
  const std::lock_guard lock(mutex_);
  error_ = std::move(error);
}

CodeSigningIdentityResult FakeCodeSigningIdentity::identify(const PeerCredentials& peer) {
  const std::lock_guard lock(mutex_);
  ++identifyCount_;
  CodeSigningIdentityResult result;
  if (error_) {
    result.error = *error_;
    return result;
  }
  if (const auto found = byPid_.find(peer.pid); found != byPid_.end()) return found->second;
  if (peer.executablePath) {
    const auto found = byExecutable_.find(*peer.executablePath);
    if (found != byExecutable_.end()) return found->second;
  }
  result.error = "no registered identity for " +
                 (peer.executablePath ? *peer.executablePath : "pid " + std::to_string(peer.pid));
  return result;
}

std::size_t FakeCodeSigningIdentity::identifyCount() const {
  const std::lock_guard lock(mutex_);
  return identifyCount_;
}

}  // namespace kestrel::platform
