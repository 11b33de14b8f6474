// The in-memory view of the containers on disk: per user, class and transient
// flag, a map from container identifier to its KSTMetadata record.
//
// A class map is built the first time it is needed, by reading every metadata
// file of the class directory, and afterwards changes only through add and
// remove (creation, replace and deletion keep it up to date). A lookup trusts
// an entry only after it has seen the entry's metadata file on disk, so it
// costs one map lookup and one lstat.
//
// Records are shared: a lookup returns the cached object itself.
//
// Locking: cacheLock_ (a plain mutex) guards both maps and every class map.
// A rebuild asks the layout objects for the class directory while holding it,
// so the order is cacheLock_ -> KSTGlobalConfiguration -> KSTPerUserConfiguration
// (global_configuration.h); nothing below calls back into the cache. The
// metadata-file test of the lookups runs after the lock has been released.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "daemon/errors.h"
#include "store/container_class.h"
#include "store/file_url.h"
#include "store/metadata.h"

namespace kestrel {

class KSTContainerCache {
 public:
  // Looks identifiers up by string_view as well as by string.
  struct IdentifierHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view identifier) const noexcept {
      return std::hash<std::string_view>{}(identifier);
    }
  };
  // Identifier -> record, for one (user, class, transient) triple. Hashed, not
  // ordered: a rebuild inserts thousands of records and a lookup finds one, and
  // both were dominated by the string comparisons of a tree. Listings sort.
  using ClassMap = std::unordered_map<std::string, KSTMetadataRef, IdentifierHash, std::equal_to<>>;

  static KSTContainerCache& sharedInstance();

  KSTContainerCache(const KSTContainerCache&) = delete;
  KSTContainerCache& operator=(const KSTContainerCache&) = delete;

  // The container of that identifier, once its metadata file is seen on disk.
  // Errors: 47 (bad class or identifier), 43 (the class map could not be
  // built), 21 (not cached; not logged), 44 (cached, but its metadata file is
  // gone: the entry stays), 40 (an exception).
  KSTMetadataRef containerForUser(std::uint32_t user, KSTContainerClass contentClass,
                                  std::optional<std::string_view> identifier, bool transient,
                                  KSTErrorRef* error);

  // The live container, else the transient one, of that identifier whose
  // UUID text is uuidString; its transient flag is set to say which.
  KSTMetadataRef containerForUser(std::uint32_t user, KSTContainerClass contentClass,
                                  std::optional<std::string_view> identifier,
                                  std::string_view uuidString);

  // Every cached container whose metadata file is on disk (those without are
  // logged and left out, but stay cached). Errors 47, 43, 40.
  std::optional<std::vector<KSTMetadataRef>> allContainersForUser(std::uint32_t user,
                                                                  KSTContainerClass contentClass,
                                                                  bool transient,
                                                                  KSTErrorRef* error);
  std::optional<std::vector<std::string>> allContainerIdentifiersForUser(
      std::uint32_t user, KSTContainerClass contentClass, bool transient, KSTErrorRef* error);

  // Caches the record under its identifier (replacing any entry) with url as
  // its container directory. Errors 47, 43, 40.
  bool addContainerMetadata(const KSTMetadataRef& metadata, std::uint32_t forUser,
                            const KSTFileURL& url, bool transient, KSTErrorRef* error);

  // Drops the identifier's entry; an identifier that is not cached is no
  // error. Errors 47, 43, 40.
  bool removeContainerForUser(std::uint32_t user, KSTContainerClass contentClass,
                              std::optional<std::string_view> identifier, bool transient,
                              KSTErrorRef* error);

  // For tests and benchmarks only: forgets the class map of the triple, so the
  // next call that needs it rebuilds it from the class directory. The daemon
  // itself never discards a class map.
  void _discardClassMapForUser(std::uint32_t user, KSTContainerClass contentClass, bool transient);

 private:
  KSTContainerCache() = default;

  // The class map of the triple, built from the class directory on first use.
  // The caller holds cacheLock_. nullptr with an error when the pair is
  // refused (47) or the directory cannot be listed.
  ClassMap* _getCacheForUserId(std::uint32_t userId, KSTContainerClass contentClass, bool transient,
                               KSTErrorRef* error);

  // _getCacheForUserId, or error 43 (on behalf of function) with its error beneath.
  ClassMap* classMapOrRebuildError(const char* function, std::uint32_t userId,
                                   KSTContainerClass contentClass, bool transient,
                                   KSTErrorRef* error);

  std::mutex cacheLock_;
  // Key "%u-%@" (user id, class path) -> class map; the flag picks the map.
  std::unordered_map<std::string, ClassMap> liveContainerCache_;
  std::unordered_map<std::string, ClassMap> transientContainerCache_;
};

}  // namespace kestrel
