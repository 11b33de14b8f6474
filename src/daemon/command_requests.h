// The request keys of every command, decoded in one place per command, and the
// reply keys of those that answer with more than a code.
//
// Decoding rules, the same for every command:
//   - a key that is absent reads as 0 (uint64, int64), false (boolean) or
//     nothing (string, UUID, array, property list);
//   - a key that holds another type than its command names reads as absent,
//     as the message's typed reads do, and the operation then acts as it does
//     for an absent key; a debug line names the key and both types;
//   - "UserID" keys keep their low 32 bits and are checked by validateUserId
//     against the class the command names; a failed check ends the decoding
//     with 38 (validateUserId logs it);
//   - the own identifier is the "Identifier" string when there is one, else
//     the client's own signing identifier (which may be absent).
//
// Each decoder returns nothing, with the code set, when the request cannot
// be carried out.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "daemon/client_connection.h"
#include "platform/message_ipc.h"
#include "platform/plist.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/metadata.h"

namespace kestrel {

// 0: create or look up a container.
struct KSTCreateOrLookupRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<std::string> identifier;  // the own identifier
  bool createIfNecessary = false;
  bool transient = false;
};
std::optional<KSTCreateOrLookupRequest> KSTDecodeCreateOrLookupRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 1: list the containers of a class.
struct KSTListContainersRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  bool transient = false;
};
std::optional<KSTListContainersRequest> KSTDecodeListContainersRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 2: replace a container by another. Without "OldContainerUUID" the old
// class and user are 0 and the old identifier is nothing (the other old keys
// are then not read).
struct KSTReplaceContainerRequest {
  std::optional<platform::Uuid> oldContainerUUID;
  KSTContainerClass oldContainerClass = 0;
  std::optional<std::string> oldIdentifier;
  std::uint32_t oldUserId = 0;
  KSTContainerClass newContainerClass = 0;
  std::uint32_t newUserId = 0;
  std::optional<platform::Uuid> newContainerUUID;
  std::optional<std::string> newIdentifier;
};
std::optional<KSTReplaceContainerRequest> KSTDecodeReplaceContainerRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 3: stage containers for deletion. The four arrays are read at the same
// index by the operation, which checks each entry itself: an entry of the
// wrong type is kept as nothing so that it can say so. The arrays' own keys
// must hold arrays (or be absent: empty). Entry i of "UserIDsArray" is checked
// against entry i of "ContainerClassesArray" (a class entry that is not a
// number counts as class 0); a classes array shorter than the user ids is
// error 11. A non-array "IdentifiersArray" is logged and read as nothing.
struct KSTStageForDeleteRequest {
  std::vector<std::uint32_t> userIds;  // resolved
  std::vector<std::optional<platform::Uuid>> uuids;
  std::optional<std::vector<std::optional<std::string>>> identifiers;
  std::vector<std::optional<KSTContainerClass>> containerClasses;
};
std::optional<KSTStageForDeleteRequest> KSTDecodeStageForDeleteRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 5: set an info value ("Value" is any property list; nothing removes it).
struct KSTSetInfoValueRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<PlistValue> value;
  std::optional<std::string> key;
  std::optional<platform::Uuid> uuid;
  std::optional<std::string> identifier;
};
std::optional<KSTSetInfoValueRequest> KSTDecodeSetInfoValueRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 6: get an info value.
struct KSTInfoValueRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<std::string> key;
  std::optional<platform::Uuid> uuid;
  std::optional<std::string> identifier;
};
std::optional<KSTInfoValueRequest> KSTDecodeInfoValueRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 7: a container's metadata.
struct KSTMetadataRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<platform::Uuid> uuid;
  std::optional<std::string> identifier;
  bool infoDictRequested = false;
};
std::optional<KSTMetadataRequest> KSTDecodeMetadataRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 8 and 22 (recreate the default structure), 9 (new directory UUID) and 23
// (disk usage): one container named by class, user, UUID and identifier.
struct KSTContainerRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<platform::Uuid> uuid;
  std::optional<std::string> identifier;
};
std::optional<KSTContainerRequest> KSTDecodeContainerRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 10: delete a container.
struct KSTDeleteContainerRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<std::string> identifier;
  bool transient = false;
};
std::optional<KSTDeleteContainerRequest> KSTDecodeDeleteContainerRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 11 (class is always 4, Data/VantlerPlugin, and the user is checked against
// it) and 12 (class from the request): wipe a data container's content.
struct KSTWipeContainerRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<std::string> identifier;
};
std::optional<KSTWipeContainerRequest> KSTDecodeWipePluginContainerRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);
std::optional<KSTWipeContainerRequest> KSTDecodeWipeContainerRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 13 and 14: the app groups of the own identifier for a user (checked
// against class 7).
struct KSTAppGroupRequest {
  std::uint32_t userId = 0;
  std::optional<std::string> identifier;  // the own identifier
};
std::optional<KSTAppGroupRequest> KSTDecodeAppGroupRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 15 and 16: the system container (group paths) of the own identifier.
struct KSTOwnIdentifierRequest {
  std::optional<std::string> identifier;  // the own identifier
};
std::optional<KSTOwnIdentifierRequest> KSTDecodeOwnIdentifierRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 17: one system group container's path.
struct KSTSystemGroupPathRequest {
  std::optional<std::string> identifier;  // the own identifier
  std::optional<std::string> groupIdentifier;
};
std::optional<KSTSystemGroupPathRequest> KSTDecodeSystemGroupPathRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 18: process code-signing information. Both property lists may be of any
// type; the operation decides what it accepts.
struct KSTProcessCodeSigningInfoRequest {
  std::optional<PlistValue> codeSigningInfo;
  std::optional<std::string> identifier;
  std::optional<PlistValue> options;
};
std::optional<KSTProcessCodeSigningInfoRequest> KSTDecodeProcessCodeSigningInfoRequest(
    const platform::MessageDictionary& request, std::uint64_t* error);

// 19: an identifier ("Identifier" only; no own-identifier rule).
struct KSTIdentifierRequest {
  std::optional<std::string> identifier;
};
std::optional<KSTIdentifierRequest> KSTDecodeIdentifierRequest(
    const platform::MessageDictionary& request, std::uint64_t* error);

// 21: set a data container's protection class. "DataProtectionClass" is an
// int64 passed on as a signed 32-bit class; one outside that range is 38.
struct KSTDataProtectionRequest {
  KSTContainerClass containerClass = 0;
  std::uint32_t userId = 0;
  std::optional<std::string> identifier;
  std::int32_t dataProtectionClass = 0;
  bool isThirdParty = false;
  bool retryIfLocked = false;
};
std::optional<KSTDataProtectionRequest> KSTDecodeDataProtectionRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 25: the retry test (user checked against class 2).
struct KSTRetryTestRequest {
  std::uint32_t userId = 0;
  std::uint64_t numRetryCrashes = 0;
};
std::optional<KSTRetryTestRequest> KSTDecodeRetryTestRequest(
    const platform::MessageDictionary& request, const KSTClientConnection& client,
    std::uint64_t* error);

// 26: stage shared content.
struct KSTStageSharedContentRequest {
  std::optional<std::string> identifier;
  std::optional<std::string> sourcePath;
  std::optional<std::string> destPath;
};
std::optional<KSTStageSharedContentRequest> KSTDecodeStageSharedContentRequest(
    const platform::MessageDictionary& request, std::uint64_t* error);

// --- Replies ---

// 0: "ReplyUUID" (the internal UUID), "ReplyExisted", "ReplyPath", "ReplyIdentifier".
void KSTEncodeContainerReply(const KSTMetadata& container, platform::MessageDictionary* reply);
// 1: "ReplyIdsArray" and "ReplyUUIDsArray", entry i of one belonging to entry i of the other.
void KSTEncodeContainerListReply(const std::vector<KSTMetadataRef>& containers,
                                 platform::MessageDictionary* reply);
// 7: "ReplyPath", "ReplyTransient" and, when asked for and present, "ReplyInfoDictionary".
void KSTEncodeMetadataReply(const KSTMetadata& container, bool infoDictRequested,
                            platform::MessageDictionary* reply);
// "ReplyPath" (15, 17, 26).
void KSTEncodePathReply(const std::string& path, platform::MessageDictionary* reply);
// A property-list reply key (6 "ReplyInfoValue", 13/16 "ReplyGroupContainerDict",
// 14 "ReplyGroupIdentifiersArray", 19 "ReplyInfoDictionary"). False, with
// nothing set, when the value is nested too deep to travel.
bool KSTEncodePlistReply(const char* key, const PlistValue& value,
                         platform::MessageDictionary* reply);
// 23: "ReplyDiskUsage" in bytes.
void KSTEncodeDiskUsageReply(std::uint64_t bytes, platform::MessageDictionary* reply);

}  // namespace kestrel
