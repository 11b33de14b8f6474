// The preamble the operations on one existing container share: the address
// (user, internal UUID, identifier, class) must name a container, and the
// cache must hold it, found under the identifier lock of the UUID's text.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/metadata.h"

namespace kestrel {

// Error 11 (logged, on behalf of `function`) when the address has no UUID or
// its class lies outside 1..13; nothing when it can name a container.
KSTErrorRef KSTInvalidContainerAddress(const char* function, std::uint32_t userId,
                                       const std::optional<platform::Uuid>& uuid,
                                       KSTContainerClass containerClass);

// The cached container of the address, or nothing with error 21 (logged, on
// behalf of `function`).
KSTMetadataRef KSTCachedContainer(const char* function, std::uint32_t userId,
                                  const std::string& uuidString,
                                  const std::optional<std::string>& identifier,
                                  KSTContainerClass containerClass, KSTErrorRef* error);

// How the identifier lock of the container's UUID is held while the work
// runs; None when the caller holds it already (its useLocking unset).
enum class KSTContainerLock { Writing, Reading, None };

// An operation on one existing container, on behalf of `function`: error 11
// for an address that cannot name one; then `check`, the operation's own
// arguments (its error, if any, is handed over as it is); then, with
// exceptions caught (error 40), the lock taken and the container looked up
// in the cache (error 21 when it holds none), `work(container)` runs under the
// lock. Its result, or a value-initialised one when it did not run.
template <typename Check, typename Work>
std::invoke_result_t<Work, const KSTMetadataRef&> KSTOnCachedContainer(
    const char* function, std::uint32_t userId, const std::optional<platform::Uuid>& uuid,
    const std::optional<std::string>& identifier, KSTContainerClass containerClass,
    KSTContainerLock lock, std::uint64_t* withError, Check&& check, Work&& work) {
  using Result = std::invoke_result_t<Work, const KSTMetadataRef&>;
  if (KSTErrorRef invalid = KSTInvalidContainerAddress(function, userId, uuid, containerClass)) {
    KSTHandOverCode(invalid, withError);
    return Result();
  }
  if (KSTErrorRef refused = std::forward<Check>(check)()) {
    KSTHandOverCode(refused, withError);
    return Result();
  }
  const auto locked = [&]() -> Result {
    const std::string uuidString = uuid->string();
    std::optional<KSTIdentifierLockGuard> guard;
    if (lock != KSTContainerLock::None) {
      guard.emplace(uuidString,
                    lock == KSTContainerLock::Writing ? kKSTLockForWriting : kKSTLockForReading);
    }
    KSTErrorRef failure;
    const KSTMetadataRef container =
        KSTCachedContainer(function, userId, uuidString, identifier, containerClass, &failure);
    if (!container) {
      KSTHandOverCode(failure, withError);
      return Result();
    }
    return std::forward<Work>(work)(container);
  };
  if constexpr (std::is_void_v<Result>) {
    KSTRunCatchingExceptions(function, __LINE__, withError, locked);
  } else {
    return KSTRunCatchingExceptions(function, __LINE__, withError, Result(), locked);
  }
}

// The same without a check of the operation's own arguments.
template <typename Work>
std::invoke_result_t<Work, const KSTMetadataRef&> KSTOnCachedContainer(
    const char* function, std::uint32_t userId, const std::optional<platform::Uuid>& uuid,
    const std::optional<std::string>& identifier, KSTContainerClass containerClass,
    KSTContainerLock lock, std::uint64_t* withError, Work&& work) {
  return KSTOnCachedContainer(
      function, userId, uuid, identifier, containerClass, lock, withError,
      [] { return KSTErrorRef(); }, std::forward<Work>(work));
}

}  // namespace kestrel
