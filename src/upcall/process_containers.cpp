// The one routine of the upcall server: which containers a starting process
// gets. Each is found or made; the reply lists their paths, then a status.
#include <map>
#include <new>
#include <optional>
#include <string>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/log.h"
#include "platform/plist.h"
#include "platform/services.h"
#include "store/container_class.h"
#include "store/container_identifier.h"
#include "store/global_configuration.h"
#include "store/per_user_configuration.h"
#include "upcall/packbuff.h"
#include "upcall/upcall_items.h"
#include "upcall/upcall_server.h"

namespace kestrel {

namespace {

constexpr const char* kTag = "server_get_process_containers";
constexpr std::size_t kReplyBlockSize = 4096;
constexpr const char* kRootHomeDirectory = "/private/var/root";

struct ProcessContainersRequest {
  std::optional<std::string> signingIdentifier;
  std::optional<std::string> containerIdentifier;
  std::optional<std::string> applicationIdentifier;
  std::optional<std::string> systemContainerIdentifier;
  std::optional<std::uint32_t> persona;
  std::optional<std::uint32_t> containerType;
  std::vector<std::string> groups;
  std::vector<std::string> systemGroups;
};

// Group identifier -> its container's path.
using GroupPaths = std::map<std::string, std::string>;

std::optional<std::string> unpackToString(packbuff* buffer, const char* itemName) {
  int error = 0;
  const char* string = sb_packbuff_unpack_string(buffer, nullptr, &error);
  if (error != 0) {
    KSTLog(kLogError, "failed: to unpack string for %s. error: %d\n", itemName, error);
    return std::nullopt;
  }
  return std::string(string);
}

std::optional<std::uint32_t> unpackUInt32(packbuff* buffer, const char* failure) {
  int error = 0;
  const std::uint32_t value = sb_packbuff_unpack_uint32(buffer, &error);
  if (error != 0) {
    KSTLogTag(kLogError, kTag, failure, error);
    return std::nullopt;
  }
  return value;
}

// Reads every item; 0, or the routine's return code.
std::int32_t readRequest(packbuff* buffer, ProcessContainersRequest* request) {
  std::uint16_t valueType = 0;
  while (sb_packbuff_get_item_value_type(buffer, &valueType)) {
    std::optional<std::string> string;
    std::optional<std::uint32_t> number;
    switch (valueType) {
      case kKSTUpcallRequestCodeSignatureId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_CODE_SIGNATURE_ID");
        request->signingIdentifier = string;
        break;
      case kKSTUpcallRequestContainerId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_CONTAINER_ID");
        request->containerIdentifier = string;
        break;
      case kKSTUpcallRequestApplicationId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_APPLICATION_ID");
        request->applicationIdentifier = string;
        break;
      case kKSTUpcallRequestPersonaId:
        number = unpackUInt32(buffer,
                              "failed: to unpack uint32 for KS_KERN_REQUEST_PERSONA_ID. "
                              "error: %d\n");
        if (!number) return kKSTUpcallBadRequest;
        request->persona = number;
        continue;
      case kKSTUpcallRequestAppGroupId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_APP_GROUP_ID");
        if (string) request->groups.push_back(*string);
        break;
      case kKSTUpcallRequestContainerType:
        number = unpackUInt32(buffer,
                              "failed: to unpack uint32 for KS_KERN_REQUEST_CONTAINER_TYPE. "
                              "error: %d\n");
        if (!number) return kKSTUpcallBadRequest;
        request->containerType = number;
        continue;
      case kKSTUpcallRequestSystemContainerId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_CONTAINER_ID");
        request->systemContainerIdentifier = string;
        break;
      case kKSTUpcallRequestSystemGroupId:
        string = unpackToString(buffer, "KS_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID");
        if (string) request->systemGroups.push_back(*string);
        break;
      default:
        KSTLogTag(kLogError, kTag, "unexpected value: %u\n", static_cast<unsigned>(valueType));
        return kKSTUpcallUnknownValueType;
    }
    if (!string) return kKSTUpcallBadRequest;
  }
  return kKSTUpcallAnswered;
}

// The data container's class: the one the code-signing information names,
// with a plug-in always in the plug-in class.
KSTContainerClass dataContainerClass(const std::string& identifier, std::uint32_t sandboxType) {
  KSTContainerClass containerClass =
      KSTCodeSigningMapping::sharedInstance().dataContainerTypeForIdentifier(identifier);
  const bool plugin = sandboxType == kKSTUpcallContainerTypePlugin;
  if (!KSTIsPerUserClass(containerClass)) {
    KSTLogTag(kLogError, kTag, "Invalid data container class for %@: %llu",
              KSTIdentifierForLog(identifier), containerClass);
    containerClass =
        plugin ? kKSTContainerClassDataVantlerPlugin : kKSTContainerClassDataApplication;
    KSTLogTag(kLogNotice, kTag, "SB Type: %u, falling back to class: %llu", sandboxType,
              containerClass);
  } else if (plugin && containerClass != kKSTContainerClassDataVantlerPlugin) {
    KSTLogTag(kLogNotice, kTag, "SB Type: %u, TS Type: %llu.  Declaring this a plugin", sandboxType,
              containerClass);
    containerClass = kKSTContainerClassDataVantlerPlugin;
  } else if (sandboxType == kKSTUpcallContainerTypeApplication &&
             containerClass != kKSTContainerClassDataApplication) {
    KSTLogTag(kLogNotice, kTag, "SB type is app, but TS type is %llu", containerClass);
  }
  return containerClass;
}

// The container's path, or nothing with the failure logged.
std::optional<std::string> containerPath(std::uint32_t user, const std::string& identifier,
                                         KSTContainerClass containerClass, const char* failure) {
  std::uint64_t code = kKSTSuccess;
  const KSTMetadataRef container =
      KSTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
          user, identifier, true, containerClass, false, true, &code);
  if (!container) {
    KSTLogTag(kLogError, kTag, failure, code);
    return std::nullopt;
  }
  return container->url().path();
}

// Every group's path; false when one could not be had (the others are still made).
bool groupPaths(std::uint32_t user, const std::vector<std::string>& groups,
                KSTContainerClass containerClass, const char* failure, GroupPaths* paths) {
  bool all = true;
  for (const std::string& group : groups) {
    if (std::optional<std::string> path = containerPath(user, group, containerClass, failure)) {
      paths->insert_or_assign(group, std::move(*path));
    } else {
      all = false;
    }
  }
  return all;
}

std::optional<std::string> homeDirectory(std::uint32_t user) {
  if (user == kKSTRootUserId) return platform::services().root.resolve(kRootHomeDirectory);
  const auto configuration =
      KSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(user);
  if (!configuration || !configuration->userHomeDirectory()) return std::nullopt;
  return configuration->userHomeDirectory()->path();
}

PlistValue describedPaths(const GroupPaths& paths) {
  PlistDictionary dictionary;
  for (const auto& [group, path] : paths) dictionary.insert_or_assign(group, PlistValue(path));
  return PlistValue(std::move(dictionary));
}

// Packs one path while everything so far was packed; false when it fails.
bool packPath(packbuff* reply, std::uint16_t valueType, const std::optional<std::string>& path) {
  if (!path) return true;
  const int error = sb_packbuff_pack_string(reply, valueType, path->c_str(), path->size());
  if (error == 0) return true;
  KSTLogTag(kLogError, kTag, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", error,
            static_cast<unsigned>(valueType), *path);
  return false;
}

bool packGroups(packbuff* reply, std::uint16_t keyType, std::uint16_t valueType,
                const GroupPaths& paths, const char* failure) {
  for (const auto& [group, path] : paths) {
    const int error = sb_packbuff_pack_key_with_string_value(reply, keyType, group.c_str(),
                                                             valueType, path.c_str());
    if (error != 0) {
      KSTLogTag(kLogError, kTag, failure, error, group, path);
      return false;
    }
  }
  return true;
}

}  // namespace

std::int32_t server_get_process_containers(pid_t senderPid, std::span<const std::uint8_t> request,
                                           KSTUpcallOutOfLine* reply) {
  // Only the kernel may ask.
  if (senderPid != 0) return kKSTUpcallBadRequest;

  ProcessContainersRequest items;
  {
    // Wrapped with content, the buffer is only read.
    PackbuffRef buffer = sb_packbuff_init_with_buffer(const_cast<std::uint8_t*>(request.data()),
                                                      request.size(), true, kSBPackbuffDeallocNone);
    if (!buffer) {
      KSTLog(kLogError, "sb_packbuff_init() of request data fails");
      return kKSTUpcallNoMemory;
    }
    if (const std::int32_t code = readRequest(buffer.get(), &items); code != kKSTUpcallAnswered) {
      return code;
    }
  }
  PackbuffRef packed = sb_packbuff_new(kReplyBlockSize);
  if (!packed) return kKSTUpcallNoMemory;

  const std::optional<std::string>& identifier =
      items.containerIdentifier ? items.containerIdentifier : items.signingIdentifier;
  bool status = true;
  const std::uint32_t user = items.persona.value_or(kKSTRootUserId);
  // Set by every upcall, and they stay set; written only the first time.
  KSTClientConnection& connection = KSTClientConnection::sharedClientConnection();
  if (!connection.allowOtherIdLookup()) connection.setAllowOtherIdLookup(true);
  if (!connection.allowGroupIdLookup()) connection.setAllowGroupIdLookup(true);

  std::optional<std::string> dataContainer;
  if (identifier) {
    const KSTContainerClass containerClass =
        dataContainerClass(*identifier, items.containerType.value_or(0));
    dataContainer = containerPath(user, *identifier, containerClass,
                                  "createOrLookupContainerForUser: Failed with error: %llu");
    status = status && dataContainer;
  }
  std::optional<std::string> systemContainer;
  if (items.systemContainerIdentifier) {
    systemContainer = containerPath(
        kKSTSystemContainerUserId, *items.systemContainerIdentifier, kKSTContainerClassDataSystem,
        "createOrLookupContainerForUser:(system container) Failed with error: %llu");
    status = status && systemContainer;
  }
  GroupPaths groups;
  status = groupPaths(user, items.groups, kKSTContainerClassSharedAppGroup,
                      "createOrLookupGroupContainersForUser: Failed with error: %llu", &groups) &&
           status;
  GroupPaths systemGroups;
  status =
      groupPaths(kKSTSystemContainerUserId, items.systemGroups, kKSTContainerClassSharedSystemGroup,
                 "createOrLookupContainerForUser:(system group container) Failed with "
                 "error: %llu",
                 &systemGroups) &&
      status;

  std::optional<std::string> temporaryDirectory;
  std::optional<std::string> home;
  if (status) {
    if (dataContainer)
      temporaryDirectory = KSTFileURL(*dataContainer, true).appending("tmp").path();
    home = homeDirectory(user);
    if (Log::isEnabled(kLogDebug)) {
      KSTLogTag(kLogDebug, kTag, "UPCALL-Containers for %@(%u):", KSTIdentifierForLog(identifier),
                user);
      KSTLogTag(kLogDebug, kTag, "dataContainerURL: %@", dataContainer);
      KSTLogTag(kLogDebug, kTag, "tempContainerURL: %@", temporaryDirectory);
      KSTLogTag(kLogDebug, kTag, "homeDirURL: %@", home);
      KSTLogTag(kLogDebug, kTag, "groupURLs: %@", describedPaths(groups));
      KSTLogTag(kLogDebug, kTag, "systemContainerURL: %@", systemContainer);
      KSTLogTag(kLogDebug, kTag, "systemGroupURLs: %@", describedPaths(systemGroups));
    }
  }

  status = status && packPath(packed.get(), kKSTUpcallReplyHomeDirectory, home);
  status = status && packPath(packed.get(), kKSTUpcallReplyDataContainer, dataContainer);
  status = status && packPath(packed.get(), kKSTUpcallReplyTemporaryDirectory, temporaryDirectory);
  status = status &&
           packGroups(packed.get(), kKSTUpcallReplyGroupId, kKSTUpcallReplyGroupContainer, groups,
                      "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: "
                      "%s, group container: %s\n");
  status = status && packPath(packed.get(), kKSTUpcallReplySystemContainer, systemContainer);
  status = status &&
           packGroups(packed.get(), kKSTUpcallReplySystemGroupId,
                      kKSTUpcallReplySystemGroupContainer, systemGroups,
                      "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, system "
                      "group container: %s\n");
  const std::uint32_t statusValue = status ? 1 : 0;
  if (const int error = sb_packbuff_pack_uint32(packed.get(), kKSTUpcallReplyStatus, statusValue)) {
    KSTLogTag(kLogError, kTag, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", error,
              static_cast<unsigned>(kKSTUpcallReplyStatus), statusValue);
  }

  // The copy that travels as the reply's region.
  const std::uint8_t* bytes = sb_packbuff_get_bytes(packed.get());
  const std::size_t size = bytes == nullptr ? 0 : sb_packbuff_get_size(packed.get());
  try {
    reply->bytes.assign(bytes, bytes + size);
    reply->deallocate = true;
  } catch (const std::bad_alloc&) {
    KSTLogTag(kLogError, kTag, "failed: to copy the packed reply of %zu bytes", size);
    reply->bytes.clear();
    reply->deallocate = false;
  }
  return kKSTUpcallAnswered;
}

}  // namespace kestrel
