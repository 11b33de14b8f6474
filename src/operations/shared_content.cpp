// Shared-content staging: a client entitled to a system group container has
// one item inside it moved from one relative path to another, by the daemon
// and after its access-control lists were reset.
//
// The paths are confined twice. realPathForURL checks them as the file system
// is when the request comes; but whoever may write in the container could
// swap a path component for a link to the outside right after. So nothing
// after the check resolves a path from the container's own path: the parent
// directories are opened beneath a descriptor of the container (openat2, no
// escaping link, no magic link, no other mount), the ACLs are reset through
// descriptors, and the checked leaf names are renamed relative to those
// parents. docs/security.md says what that guarantees and what not.
#include <fcntl.h>
#include <stdio.h>
#include <unistd.h>

#include <algorithm>

#include <cerrno>
#include <string>
#include <system_error>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "daemon/exceptions.h"
#include "daemon/locks.h"
#include "platform/file_system.h"
#include "platform/unique_fd.h"
#include "store/container_cache.h"
#include "store/file_manager.h"
#include "store/plist_io.h"

namespace kestrel {

namespace {

constexpr const char* kStage = "stageSharedContentForIdentifier";

// A path relative to the container, as its parent directory and its last
// name; no name when it names the container itself.
struct Placement {
  std::string parent;
  std::string leaf;
};
Placement placementOf(const std::string& relative) {
  Placement placement;
  std::size_t start = 0;
  while (start <= relative.size()) {
    std::size_t slash = relative.find('/', start);
    if (slash == std::string::npos) slash = relative.size();
    const std::string name = relative.substr(start, slash - start);
    if (!name.empty() && name != ".") {
      if (!placement.leaf.empty()) {
        placement.parent += (placement.parent.empty() ? "" : "/") + placement.leaf;
      }
      placement.leaf = name;
    }
    start = slash + 1;
  }
  return placement;
}

std::string errnoText(int error) {
  return std::generic_category().message(error);
}

}  // namespace

std::optional<KSTFileURL> KSTClientConnection::stageSharedContentForIdentifier(
    const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath, std::uint64_t* withError) {
  if (!identifier || !sourceRelativePath || !destRelativePath) {
    KSTHandOverCode(KST_ERROR(kKSTErrorInvalidObject, nullptr, true,
                              "Can't act on invalid input: ID: %@, source: %@, dest: %@",
                              identifier, sourceRelativePath, destRelativePath),
                    withError);
    return std::nullopt;
  }
  if (KSTContainsDotDotPathComponents(*sourceRelativePath) ||
      KSTContainsDotDotPathComponents(*destRelativePath)) {
    KSTHandOverCode(KST_ERROR(kKSTErrorInvalidParameter, nullptr, true,
                              "Paths can't contain dots. source: %@, dest: %@", *sourceRelativePath,
                              *destRelativePath),
                    withError);
    return std::nullopt;
  }
  bool entitled = false;
  if (clientBundleIdentifier_) {
    const KSTGroupIdentifiers groups =
        KSTCodeSigningMapping::sharedInstance().systemGroupIdentifiersForIdentifier(
            *clientBundleIdentifier_);
    entitled = groups && std::find(groups->begin(), groups->end(), *identifier) != groups->end();
  }
  if (!entitled) {
    KSTHandOverCode(KST_ERROR(kKSTErrorNotEntitled, nullptr, true,
                              "%@ not entitled for system group container %@",
                              clientBundleIdentifier_, *identifier),
                    withError);
    return std::nullopt;
  }
  KSTErrorRef lookupError;
  const KSTMetadataRef container = KSTContainerCache::sharedInstance().containerForUser(
      kKSTSystemContainerUserId, kKSTContainerClassSharedSystemGroup, *identifier, false,
      &lookupError);
  if (!container) {
    KSTHandOverCode(KST_ERROR(kKSTErrorNotFound, lookupError, true,
                              "System group container with identifier %@ not found: %@",
                              *identifier, lookupError),
                    withError);
    return std::nullopt;
  }

  KSTErrorRef failure;
  std::optional<KSTFileURL> result =
      KST_CATCH_EXCEPTIONS(withError, std::nullopt, [&]() -> std::optional<KSTFileURL> {
        const KSTIdentifierLockGuard lock(container->uuid().string(), kKSTLockForWriting);
        const KSTFileURL containerURL = container->url();
        const KSTFileURL sourceURL = containerURL.appending(*sourceRelativePath);
        const KSTFileURL destURL = containerURL.appending(*destRelativePath);
        const KSTFileManager& files = KSTFileManager::defaultManager();
        const Placement source = placementOf(*sourceRelativePath);
        const Placement dest = placementOf(*destRelativePath);
        // A path that names the container itself names nothing to move.
        if (source.leaf.empty() || !files.realPathForURL(sourceURL, containerURL)) {
          failure = KST_ERROR_IN(kStage, kKSTErrorInvalidURL, nullptr, true,
                                 "Invalid source URL %@ for %@ at %@", sourceURL, *identifier,
                                 containerURL);
          return std::nullopt;
        }
        if (dest.leaf.empty() || !files.realPathForURL(destURL, containerURL)) {
          failure =
              KST_ERROR_IN(kStage, kKSTErrorInvalidURL, nullptr, true,
                           "Invalid dest URL %@ for %@ at %@", destURL, *identifier, containerURL);
          return std::nullopt;
        }

        // From here on, descriptors beneath the container only.
        const platform::UniqueFd base(
            ::open(containerURL.fileSystemRepresentation(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        const auto openParent = [&](const std::string& parent, platform::UniqueFd* opened) {
          if (!base) return errno;
          int fd = -1;
          const int error =
              platform::openBeneath(base.get(), parent.c_str(), O_RDONLY | O_DIRECTORY, &fd);
          if (error == 0) opened->reset(fd);
          return error;
        };
        const auto beneathError = [&](int error, const std::string& parent) {
          return KST_POSIX_ERROR_IN(kStage, error, "open of %s beneath %@ failed: %s", parent,
                                    containerURL, errnoText(error));
        };
        platform::UniqueFd sourceParent;
        KSTErrorRef aclError;
        if (const int error = openParent(source.parent, &sourceParent); error != 0) {
          aclError = beneathError(error, source.parent);
        } else {
          files.standardizeACLsBeneath(sourceParent.get(), source.leaf, false, sourceURL.path(),
                                       &aclError);
        }
        if (aclError) {
          failure = KST_ERROR_IN(kStage, kKSTErrorACLFailed, aclError, true,
                                 "Failed to standardize ACLs for %@ at %@: %@", *identifier,
                                 sourceURL, aclError);
          return std::nullopt;
        }
        platform::UniqueFd destParent;
        KSTErrorRef moveError;
        if (const int error = openParent(dest.parent, &destParent); error != 0) {
          moveError = beneathError(error, dest.parent);
        } else if (::renameat(sourceParent.get(), source.leaf.c_str(), destParent.get(),
                              dest.leaf.c_str()) != 0) {
          const int renamed = errno;
          moveError = KST_POSIX_ERROR_IN(kStage, renamed, "rename of %@ to %@ failed: %s",
                                         sourceURL, destURL, errnoText(renamed));
        }
        if (moveError) {
          failure = KST_ERROR_IN(kStage, kKSTErrorSharedContentMoveFailed, moveError, true,
                                 "Failed move for %@ from %@ to: %@: %@", *identifier, sourceURL,
                                 destURL, moveError);
          return std::nullopt;
        }
        // The move is the client's: it reaches the disk before the reply.
        ::fsync(destParent.get());
        ::fsync(sourceParent.get());
        return destURL;
      });
  if (!result && failure) KSTHandOverCode(failure, withError);
  return result;
}

}  // namespace kestrel
