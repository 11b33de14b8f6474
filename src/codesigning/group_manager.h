// Group containers: the containers that every identifier whose entitlements
// name a group shares. Application groups (class 7) have one container per
// group and per valid user; system groups (class 13) one per group, owned by
// user 499.
//
// Reference counts are never stored: each time they are needed they are
// counted afresh from the code-signing store, one per entry whose
// entitlements name the group (invalid and placeholder entries included).
//
// Two kinds of callers, kept apart by what they are handed:
//   - the lookups (commands 13, 14, 16, 17) take the lock on all identifiers
//     for writing and ask the store through its public, queue-hopping
//     queries; they must not be called from the store's queue;
//   - the change and reconciliation run where the store is already held (on
//     its queue, or under the lock on all identifiers held by the caller) and
//     are given the store's state to read directly, so they cannot hop.
// Both stage removals without taking locks.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "platform/plist.h"
#include "store/container_class.h"

namespace kestrel {

class KSTClientConnection;

using KSTGroupType = long;
inline constexpr KSTGroupType kKSTGroupTypeApplication = 0;
inline constexpr KSTGroupType kKSTGroupTypeSystem = 1;

// Group identifier -> the number of entries that name it.
using KSTGroupReferenceCounts = std::map<std::string, long, std::less<>>;

class KSTGroupManager {
 public:
  static KSTGroupManager& defaultManager();

  // Commands 13, 16 and 17: group identifier -> path of that group's container
  // for the user, creating the containers that are missing. System groups and
  // class 13 for user 499, application groups and class 7 for any other user.
  // A group whose container cannot be had is logged and left out. Error 11 for
  // a missing identifier (before any lock), 40 for an exception.
  std::optional<PlistDictionary> groupContainerPathsForUser(
      std::uint32_t userId, KSTClientConnection& clientConnection,
      const std::optional<std::string>& identifier, std::uint64_t* withError);

  // Command 14: the identifier's application groups (an empty array when it
  // has none). The user id only appears in messages. Errors 11 and 40 as above.
  std::optional<PlistArray> groupContainerIdentifiersForUser(
      std::uint32_t userId, const std::optional<std::string>& identifier, std::uint64_t* withError);

  // An identifier's groups of the type change from old to new: each dropped
  // group whose last reference is the one going away loses its containers.
  // Called on the store's queue before the store changes, with its state.
  void handleChangeFromOldGroupContainerIds(const KSTGroupIdentifiers& old,
                                            const KSTGroupIdentifiers& toNewGroupContainerIds,
                                            KSTGroupType ofType,
                                            KSTCodeSigningMappingState& inMapping);

  // Removes every group container of the type that no entry names. Called
  // with the lock on all identifiers held for writing.
  void reconcileGroupContainersOfType(KSTGroupType type, KSTCodeSigningMappingState& inMapping);

 private:
  KSTGroupReferenceCounts _copyReferenceCountSetOfType(KSTGroupType type,
                                                       KSTCodeSigningMappingState& inMapping);
  void _removeReferenceForGroupIdentifiers(const std::vector<std::string>& identifiers,
                                           KSTGroupType ofType,
                                           KSTCodeSigningMappingState& inMapping);
  void _removeGroupContainersIfNeededforUser(std::uint32_t userId,
                                             KSTContainerClass groupContainerClass,
                                             const std::vector<std::string>& identifiers,
                                             KSTGroupReferenceCounts& referenceCounts);
  void _cleanupUnreferencedGroupContainersForUser(std::uint32_t userId,
                                                  KSTContainerClass containerClass,
                                                  const KSTGroupReferenceCounts& referenceCounts);
};

}  // namespace kestrel
