#include "store/container_cache.h"

#include <algorithm>
#include <cerrno>

#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "platform/never_destroyed.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"

namespace kestrel {

namespace {

// Log texts name a class map by its class path and this suffix.
std::string_view suffixFor(bool transient) {
  return transient ? "(transient)" : "";
}

// %ld and %lld of a class.
std::int64_t classForMessage(KSTContainerClass contentClass) {
  return static_cast<std::int64_t>(contentClass);
}

// An error of the cache, built on behalf of the public operation `function`
// (the bodies run inside a lambda, whose own name says nothing).
template <typename... Args>
KSTErrorRef cacheError(const char* function, int line, std::uint64_t code, KSTErrorRef underlying,
                       bool log, const char* format, Args&&... args) {
  return KSTCreateError(function, line, kKSTErrorDomain, static_cast<std::int64_t>(code),
                        std::move(underlying), nullptr, log, format, std::forward<Args>(args)...);
}

// Runs an operation's body; an exception thrown there becomes error 40 (logged
// and, on an internal build, reported by the shared catch clause) and the
// fallback is returned. Locks taken in the body are released by unwinding.
template <typename Fallback, typename Body>
auto runCatchingExceptions(const char* function, int line, KSTErrorRef* error, Fallback&& fallback,
                           Body&& body) {
  std::uint64_t code = kKSTSuccess;
  CaughtException caught;
  auto result =
      KSTRunCatchingExceptions(function, line, &code, std::forward<Fallback>(fallback), [&] {
        try {
          return body();
        } catch (...) {
          caught = describeCurrentException();
          throw;
        }
      });
  if (code == kKSTErrorException) {
    // The shared clause has logged it; the caller gets the same error object.
    PlistArray symbols(caught.callStackSymbols.begin(), caught.callStackSymbols.end());
    KSTSetError(error, cacheError(function, line, kKSTErrorException, nullptr, false,
                                  "Got exception: %@ : %@", caught.description(),
                                  PlistValue(std::move(symbols))));
  }
  return result;
}

#define KST_CACHE_OPERATION(error, fallback, body) \
  runCatchingExceptions(function, __LINE__, (error), (fallback), (body))

// "<user>-<class path>", the name of one class map (and how it is logged);
// built on every lookup, so without the formatter.
std::string classMapKey(std::uint32_t user, KSTContainerClass contentClass) {
  std::string key = std::to_string(user);
  key += '-';
  key += KSTContainerClassPath(contentClass);
  return key;
}

// The map's entries in identifier order, the order every listing answers in.
std::vector<const KSTContainerCache::ClassMap::value_type*> sortedEntries(
    const KSTContainerCache::ClassMap& classMap) {
  std::vector<const KSTContainerCache::ClassMap::value_type*> entries;
  entries.reserve(classMap.size());
  for (const auto& entry : classMap) entries.push_back(&entry);
  std::sort(entries.begin(), entries.end(),
            [](const auto* a, const auto* b) { return a->first < b->first; });
  return entries;
}

}  // namespace

KSTContainerCache& KSTContainerCache::sharedInstance() {
  static platform::NeverDestroyed<KSTContainerCache> instance(
      [](void* where) { return new (where) KSTContainerCache(); });
  return *instance;
}

KSTContainerCache::ClassMap* KSTContainerCache::_getCacheForUserId(std::uint32_t userId,
                                                                   KSTContainerClass contentClass,
                                                                   bool transient,
                                                                   KSTErrorRef* error) {
  if (!KSTUserIdIsValidForClass(contentClass, userId)) {
    KSTSetError(error, KST_ERROR(kKSTErrorCacheInvalidInput, nullptr, true,
                                 "Invalid cache get-userId %u for class %ld", userId,
                                 classForMessage(contentClass)));
    return nullptr;
  }
  auto& caches = transient ? transientContainerCache_ : liveContainerCache_;
  std::string key = classMapKey(userId, contentClass);
  if (auto it = caches.find(key); it != caches.end()) return &it->second;

  KSTLog(kLogDebug, "Rebuilding container class cache: %@%@", key, suffixFor(transient));
  const std::optional<KSTFileURL> directory =
      KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, contentClass,
                                                                            transient);
  if (!directory) {
    // A user without a home has no class directory: nothing can be listed.
    KSTSetError(error,
                KST_POSIX_ERROR(ENOENT, "No class directory for %@%@", key, suffixFor(transient)));
    return nullptr;
  }
  KSTErrorRef listError;
  std::optional<std::vector<KSTFileURL>> urls =
      KSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, &listError);
  if (!urls) {
    KSTSetError(error, std::move(listError));
    return nullptr;
  }

  ClassMap classMap;
  classMap.reserve(urls->size());
  for (const KSTFileURL& url : *urls) {
    // Only a directory can be a container; links are not followed out of the
    // class directory.
    if (!url.isDirectory()) continue;
    // A directory that is no valid container of this user is skipped; the
    // reader has logged why.
    KSTMetadataRef record = KSTMetadata::readAndValidateMetadataAtUrl(url, userId, true, nullptr);
    if (!record) continue;
    record->setTransient(transient);
    // Of two directories with one identifier, the later listed wins.
    classMap.insert_or_assign(record->identifier(), std::move(record));
  }
  return &caches.emplace(std::move(key), std::move(classMap)).first->second;
}

KSTContainerCache::ClassMap* KSTContainerCache::classMapOrRebuildError(
    const char* function, std::uint32_t userId, KSTContainerClass contentClass, bool transient,
    KSTErrorRef* error) {
  KSTErrorRef rebuildError;
  ClassMap* classMap = _getCacheForUserId(userId, contentClass, transient, &rebuildError);
  if (classMap == nullptr) {
    KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheRebuildFailed, rebuildError,
                                  true, "Cache: %u-%@%@: Failed to rebuild", userId,
                                  KSTContainerClassPath(contentClass), suffixFor(transient)));
  }
  return classMap;
}

KSTMetadataRef KSTContainerCache::containerForUser(std::uint32_t user,
                                                   KSTContainerClass contentClass,
                                                   std::optional<std::string_view> identifier,
                                                   bool transient, KSTErrorRef* error) {
  const char* const function = __func__;
  return KST_CACHE_OPERATION(error, nullptr, [&]() -> KSTMetadataRef {
    if (!KSTIsValidContainerClass(contentClass)) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Content Class: %ld", classForMessage(contentClass)));
      return nullptr;
    }
    if (!identifier) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid identifier: %@", nullptr));
      return nullptr;
    }
    const std::string_view classPath = KSTContainerClassPath(contentClass);
    const std::string_view suffix = suffixFor(transient);

    KSTMetadataRef record;
    {
      std::lock_guard guard(cacheLock_);
      ClassMap* classMap = classMapOrRebuildError(function, user, contentClass, transient, error);
      if (classMap == nullptr) return nullptr;
      auto it = classMap->find(*identifier);
      if (it == classMap->end()) {
        // The normal answer while a container is yet to be made: not logged.
        KSTSetError(error, cacheError(function, __LINE__, kKSTErrorNotFound, nullptr, false,
                                      "Cache: %@%@: Container Not Found with ID: %@", classPath,
                                      suffix, *identifier));
        return nullptr;
      }
      record = it->second;
    }

    // The entry is trusted only while its metadata file is on disk.
    const KSTFileURL url = record->url();
    if (url.empty()) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Cache: %@%@: Invalid URL path string: %@", classPath, suffix,
                                    nullptr));
      return nullptr;
    }
    if (url.path().front() != '/') {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Cache: %@%@: nil URL from %@", classPath, suffix, url));
      return nullptr;
    }
    const KSTFileURL metadataURL = KSTMetadata::metadataFileURL(url);
    if (!KSTFileManager::defaultManager().itemExistsAtURL(metadataURL)) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInconsistent, nullptr, true,
                                    "Cache: %@%@: INCONSISTENT-No Metadata at: %@", classPath,
                                    suffix, metadataURL));
      return nullptr;
    }
    KSTLogTag(kLogDebug, function, "Cache: %@%@: Found Identifier: %@", classPath, suffix,
              *identifier);
    return record;
  });
}

KSTMetadataRef KSTContainerCache::containerForUser(std::uint32_t user,
                                                   KSTContainerClass contentClass,
                                                   std::optional<std::string_view> identifier,
                                                   std::string_view uuidString) {
  // UUIDs are compared in their canonical form, whatever the case of the text.
  const std::optional<platform::Uuid> uuid = platform::Uuid::parse(uuidString);
  for (const bool transient : {false, true}) {
    KSTMetadataRef record = containerForUser(user, contentClass, identifier, transient, nullptr);
    if (record && uuid && record->uuid() == *uuid) {
      record->setTransient(transient);
      return record;
    }
  }
  return nullptr;
}

std::optional<std::vector<KSTMetadataRef>> KSTContainerCache::allContainersForUser(
    std::uint32_t user, KSTContainerClass contentClass, bool transient, KSTErrorRef* error) {
  const char* const function = __func__;
  using Result = std::optional<std::vector<KSTMetadataRef>>;
  return KST_CACHE_OPERATION(error, std::nullopt, [&]() -> Result {
    if (!KSTIsValidContainerClass(contentClass)) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Content Class: %ld", classForMessage(contentClass)));
      return std::nullopt;
    }
    std::vector<KSTMetadataRef> snapshot;
    {
      std::lock_guard guard(cacheLock_);
      ClassMap* classMap = classMapOrRebuildError(function, user, contentClass, transient, error);
      if (classMap == nullptr) return std::nullopt;
      const std::vector<const ClassMap::value_type*> entries = sortedEntries(*classMap);
      snapshot.reserve(entries.size());
      for (const ClassMap::value_type* entry : entries) snapshot.push_back(entry->second);
    }

    const std::string_view classPath = KSTContainerClassPath(contentClass);
    const std::string_view suffix = suffixFor(transient);
    std::vector<KSTMetadataRef> found;
    found.reserve(snapshot.size());
    for (KSTMetadataRef& record : snapshot) {
      const KSTFileURL url = record->url();
      if (url.empty() || url.path().front() != '/') {
        // Logged, not returned: the listing goes on without it.
        cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                   "Cache: %@%@: nil URL from %@", classPath, suffix, url);
        continue;
      }
      const KSTFileURL metadataURL = KSTMetadata::metadataFileURL(url);
      if (!KSTFileManager::defaultManager().itemExistsAtURL(metadataURL)) {
        cacheError(function, __LINE__, kKSTErrorCacheInconsistent, nullptr, true,
                   "Cache: %@%@: INCONSISTENT-No Metadata at: %@", classPath, suffix, metadataURL);
        continue;
      }
      KSTLogTag(kLogDebug, function, "Cache: %@%@: ALL Found Identifier: %@", classPath, suffix,
                record->identifier());
      found.push_back(std::move(record));
    }
    return found;
  });
}

std::optional<std::vector<std::string>> KSTContainerCache::allContainerIdentifiersForUser(
    std::uint32_t user, KSTContainerClass contentClass, bool transient, KSTErrorRef* error) {
  const char* const function = __func__;
  using Result = std::optional<std::vector<std::string>>;
  return KST_CACHE_OPERATION(error, std::nullopt, [&]() -> Result {
    if (!KSTIsValidContainerClass(contentClass)) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Content Class: %ld", classForMessage(contentClass)));
      return std::nullopt;
    }
    std::lock_guard guard(cacheLock_);
    ClassMap* classMap = classMapOrRebuildError(function, user, contentClass, transient, error);
    if (classMap == nullptr) return std::nullopt;
    const std::vector<const ClassMap::value_type*> entries = sortedEntries(*classMap);
    std::vector<std::string> identifiers;
    identifiers.reserve(entries.size());
    for (const ClassMap::value_type* entry : entries) identifiers.push_back(entry->first);
    return identifiers;
  });
}

bool KSTContainerCache::addContainerMetadata(const KSTMetadataRef& metadata, std::uint32_t forUser,
                                             const KSTFileURL& url, bool transient,
                                             KSTErrorRef* error) {
  const char* const function = __func__;
  return KST_CACHE_OPERATION(error, false, [&]() -> bool {
    const KSTContainerClass contentClass = metadata ? metadata->containerClass() : 0;
    if (!KSTIsValidContainerClass(contentClass)) {
      KSTSetError(
          error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                            "Invalid Metadata Content Class: %lld", classForMessage(contentClass)));
      return false;
    }
    if (url.empty()) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid input: URL: %@", nullptr));
      return false;
    }
    {
      std::lock_guard guard(cacheLock_);
      ClassMap* classMap =
          classMapOrRebuildError(function, forUser, contentClass, transient, error);
      if (classMap == nullptr) return false;
      metadata->setUrl(url);
      metadata->setTransient(transient);
      classMap->insert_or_assign(metadata->identifier(), metadata);
    }
    KSTLogTag(kLogDebug, function, "Cache: %@%@: Added Identifier: %@",
              KSTContainerClassPath(contentClass), suffixFor(transient), metadata->identifier());
    return true;
  });
}

bool KSTContainerCache::removeContainerForUser(std::uint32_t user, KSTContainerClass contentClass,
                                               std::optional<std::string_view> identifier,
                                               bool transient, KSTErrorRef* error) {
  const char* const function = __func__;
  return KST_CACHE_OPERATION(error, false, [&]() -> bool {
    if (!KSTIsValidContainerClass(contentClass)) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Content Class: %ld", classForMessage(contentClass)));
      return false;
    }
    if (!identifier) {
      KSTSetError(error, cacheError(function, __LINE__, kKSTErrorCacheInvalidInput, nullptr, true,
                                    "Invalid Identifier: %@", nullptr));
      return false;
    }
    {
      std::lock_guard guard(cacheLock_);
      ClassMap* classMap = classMapOrRebuildError(function, user, contentClass, transient, error);
      if (classMap == nullptr) return false;
      if (auto it = classMap->find(*identifier); it != classMap->end()) classMap->erase(it);
    }
    KSTLogTag(kLogDebug, function, "Cache: %@%@: Removed Identifier: %@",
              KSTContainerClassPath(contentClass), suffixFor(transient), *identifier);
    return true;
  });
}

void KSTContainerCache::_discardClassMapForUser(std::uint32_t user, KSTContainerClass contentClass,
                                                bool transient) {
  std::lock_guard guard(cacheLock_);
  auto& caches = transient ? transientContainerCache_ : liveContainerCache_;
  caches.erase(classMapKey(user, contentClass));
}

}  // namespace kestrel
