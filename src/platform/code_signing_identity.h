// The code-signing identity of a peer: its signing identifier and its
// entitlements, looked up in the registry of identities
// (<root>/etc/kestrel/signatures/*.plist).
#pragma once

#include <optional>
#include <string>

#include "platform/peer_credentials.h"
#include "platform/plist.h"

namespace kestrel::platform {

struct CodeSigningIdentityResult {
  // Absent when it could not be read; error then says why.
  std::optional<std::string> signingIdentifier;
  // Absent when the peer has no entitlements at all (admission takes an
  // empty dictionary the same way).
  std::optional<PlistDictionary> entitlements;
  std::string error;
};

class CodeSigningIdentity {
 public:
  virtual ~CodeSigningIdentity() = default;
  virtual CodeSigningIdentityResult identify(const PeerCredentials& peer) = 0;
};

}  // namespace kestrel::platform
