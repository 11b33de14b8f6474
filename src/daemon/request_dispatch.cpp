#include "daemon/request_dispatch.h"

#include <cstring>

#include "codesigning/code_signing_mapping.h"
#include "daemon/command_handlers.h"
#include "daemon/daemon_state.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "platform/services.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

bool booleanEntitlement(const PlistDictionary& entitlements, const char* key) {
  auto it = entitlements.find(key);
  return it != entitlements.end() && it->second.boolean().value_or(false);
}

// Data migration and shared-content staging are granted only by their own
// entitlements, never by "allowed".
bool needsItsOwnEntitlement(const char* entitlement) {
  return std::strcmp(entitlement, kKSTEntitlementDataMigration) == 0 ||
         std::strcmp(entitlement, kKSTEntitlementStageSharedContent) == 0;
}

// Refusal: the connection is closed and nothing is sent.
void cancelPeer(platform::MessageConnection& connection) {
  connection.cancel();
}

}  // namespace

void KSTDeferredReply::send(platform::MessageDictionary reply, std::uint64_t code) const {
  reply.setUint64(kKSTReplyErrorKey, code);
  connection_->sendReply(request_, std::move(reply));
}

std::unique_ptr<KSTClientConnection> checkEntitlementsAndInitClientObject(
    const platform::MessageConnection& connection, const KSTCommandRow& row) {
  const char* entitlement = row.entitlement;
  const bool entitlementIsNone = std::strcmp(entitlement, kKSTEntitlementNone) == 0;
  const pid_t pid = connection.pid();

  // 1. The peer's signing identifier; a failure does not refuse the client.
  platform::CodeSigningIdentityResult identity;
  if (const auto& signing = platform::services().codeSigningIdentity) {
    identity = signing->identify(connection.peerCredentials());
  } else {
    identity.error = "no code-signing identity service";
  }
  const std::optional<std::string>& bundleId = identity.signingIdentifier;
  if (!bundleId) {
    KSTLog(kLogError, "Failed to copy signing ID for pid %d : %@", pid, identity.error);
  }
  // An application held terminated is not served, whatever it is entitled to.
  const auto& lifecycle = platform::services().applicationLifecycle;
  if (bundleId && lifecycle && lifecycle->isHeldTerminated(*bundleId)) {
    KSTLog(kLogNotice, "connection attempt from pid %d (%@) refused: it is held terminated", pid,
           bundleId);
    return nullptr;
  }

  // 2-3. An empty dictionary grants nothing: such a peer has no entitlements at all.
  bool admitted = entitlementIsNone;
  if (!identity.entitlements || identity.entitlements->empty()) {
    if (!entitlementIsNone) {
      KSTLog(kLogError, "connection attempt from pid %d (%@) missing required entitlement: %s", pid,
             bundleId, entitlement);
    }
    return nullptr;
  }
  const PlistDictionary& entitlements = *identity.entitlements;

  // 4.
  bool allowOtherIdLookup = false;
  if (booleanEntitlement(entitlements, kKSTEntitlementAllowed)) {
    allowOtherIdLookup = true;
    admitted = true;
  } else {
    allowOtherIdLookup = booleanEntitlement(entitlements, kKSTEntitlementOtherIdLookup);
  }

  // 5-6.
  std::optional<std::vector<std::string>> wipeIdentifiers;
  if (std::strcmp(entitlement, kKSTEntitlementWipeContainer) == 0) {
    auto it = entitlements.find(kKSTEntitlementWipeContainer);
    if (it != entitlements.end() && it->second.isArray()) {
      // Only the strings of the array can name a container.
      std::vector<std::string> identifiers;
      for (const PlistValue& value : *it->second.array()) {
        if (value.isString()) identifiers.push_back(*value.string());
      }
      wipeIdentifiers = std::move(identifiers);
      admitted = true;
    } else {
      KSTLog(kLogError, "No entitled containers to wipe");
    }
  } else if (!admitted || needsItsOwnEntitlement(entitlement)) {
    admitted = booleanEntitlement(entitlements, entitlement);
  }

  // 7.
  if (!admitted) {
    KSTLog(kLogError, "connection attempt from pid %d (%@) missing required entitlement: %s", pid,
           bundleId, entitlement);
    return nullptr;
  }

  // 8.
  auto client = std::make_unique<KSTClientConnection>(
      bundleId, connection.effectiveUserId(), allowOtherIdLookup, std::move(wipeIdentifiers));
  // 9. A client that registered its own entitlements before, or that has no
  // information at all, has them processed again; unchanged ones change
  // nothing. Without a signing identifier there is nothing to process for.
  if (bundleId) {
    KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
    if (mapping.callerRegisteredEntitlementsNeedProcessing(entitlements, *bundleId)) {
      const std::uint64_t code =
          mapping.processCallerRegisteredEntitlements(entitlements, bundleId);
      if (code != kKSTSuccess) {
        KSTLog(kLogError, "Error processing entitlements for %@ : %llu", *bundleId,
               static_cast<unsigned long long>(code));
      }
    }
  }
  return client;
}

bool validateUserId(std::uint32_t requestedUserId, KSTContainerClass containerClass,
                    std::uint32_t clientUserId, std::uint32_t* resolvedUserId,
                    std::uint64_t* error) {
  bool valid = false;
  std::uint32_t resolved = requestedUserId;
  if (KSTIsBundleClass(containerClass)) {
    valid = requestedUserId == kKSTInstallerUserId;
  } else if (KSTIsSystemClass(containerClass)) {
    valid = requestedUserId == kKSTSystemContainerUserId;
  } else if (clientUserId < kKSTFirstMobileUserId) {
    if (requestedUserId == kKSTCurrentMobileUserAlias) {
      resolved = KSTGlobalConfiguration::sharedInstance().currentMobileUserId();
      valid = true;
    } else {
      valid = KSTUserIdIsValidForClass(containerClass, requestedUserId);
    }
  } else {
    valid = requestedUserId == clientUserId || requestedUserId == kKSTCurrentMobileUserAlias;
    resolved = clientUserId;
  }

  if (!valid) {
    if (error != nullptr) {
      KSTLog(kLogError, "Invalid userId %u for class %llu from client %u", requestedUserId,
             containerClass, clientUserId);
      *error = kKSTErrorInvalidParameter;
    }
    return false;
  }
  if (resolvedUserId != nullptr) *resolvedUserId = resolved;
  return true;
}

void KSTProcessVexelEvent(std::shared_ptr<platform::MessageConnection> connection,
                          platform::ReceivedMessage message) {
  // 2. The command index names a row of the table, or the connection goes.
  const std::uint64_t command = message.dictionary().uint64(kKSTCommandKey);
  const auto& table = KSTCommandTable();
  if (command >= kKSTCommandCount) {
    KSTLog(kLogError, "Invalid command index: %lld", command);
    cancelPeer(*connection);
    return;
  }
  const KSTCommandRow& row = table[command];
  if (row.index != command) {
    KSTLog(kLogError, "Invalid command at index %llu", command);
    cancelPeer(*connection);
    return;
  }

  // 4.
  std::unique_ptr<KSTClientConnection> client =
      checkEntitlementsAndInitClientObject(*connection, row);
  if (!client) {
    cancelPeer(*connection);
    return;
  }

  // 5.
  std::optional<platform::MessageDictionary> reply = message.makeReply();
  if (!reply) {
    KSTLog(kLogError, "Dictionary does not have reply context");
    cancelPeer(*connection);
    return;
  }

  if (!KSTCommandIsAvailable(row)) {
    KSTLog(kLogError, "Command %llu is not available", command);
    cancelPeer(*connection);
    return;
  }

  // 6.
  std::uint64_t code = kKSTSuccess;
  const KSTDeferredReply deferred(connection, message);
  KSTCommandContext context{message.dictionary(), *reply, *client, &code, deferred};
  KST_CATCH_EXCEPTIONS(&code, [&] { row.handler(context); });

  // 8-10.
  if (row.replyFlag == 0) return;
  reply->setUint64(kKSTReplyErrorKey, code);
  connection->sendReply(message, std::move(*reply));
}

bool KSTStartRequestListener(std::shared_ptr<platform::DispatchQueue> queue) {
  const auto& ipc = platform::services().messageIPC;
  if (!ipc) return false;
  std::string errorText;
  // Kept for the life of the process.
  static std::shared_ptr<platform::MessageListener> listener;
  listener =
      ipc->createListener(kKSTServiceName, std::move(queue), KSTProcessVexelEvent, &errorText);
  if (!listener) {
    KSTLog(kLogError, "Failed to create listener for %s: %@", kKSTServiceName, errorText);
    return false;
  }
  listener->resume();
  return true;
}

}  // namespace kestrel
