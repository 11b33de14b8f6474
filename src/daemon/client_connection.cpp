#include "daemon/client_connection.h"

#include "platform/never_destroyed.h"

namespace kestrel {

KSTClientConnection::KSTClientConnection(
    std::optional<std::string> bundleId, std::uint32_t clientUserId, bool allowOtherIdLookup,
    std::optional<std::vector<std::string>> entitledWipeIdentifiers)
    : clientBundleIdentifier_(std::move(bundleId)),
      clientUserId_(clientUserId),
      allowOtherIdLookup_(allowOtherIdLookup),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)) {}

KSTClientConnection::KSTClientConnection(std::optional<std::string> bundleId,
                                         bool allowOtherIdLookup)
    : KSTClientConnection(std::move(bundleId), 0, allowOtherIdLookup, std::nullopt) {}

KSTClientConnection& KSTClientConnection::sharedClientConnection() {
  static platform::NeverDestroyed<KSTClientConnection> shared([](void* where) {
    return new (where) KSTClientConnection(std::string(kInternalBundleIdentifier), true);
  });
  return *shared;
}

}  // namespace kestrel
