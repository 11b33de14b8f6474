// The making of one layout directory, shared by the global and per-user
// configurations: a layout getter never fails, so a directory that cannot be
// made is logged (tagged with the getter's name) and the URL handed back.
#pragma once

#include <sys/types.h>

#include "daemon/log.h"
#include "store/file_manager.h"

namespace kestrel {

// Makes url as asked and logs failureMessage ("Failed to create ... at \"%@\":
// %@", with the path and the error) under tag when that fails. Returns url.
inline KSTFileURL KSTMakeLayoutDirectory(
    const char* tag, const char* failureMessage, const KSTFileURL& url, bool parents,
    uid_t owner = kKSTOwnerLeaveAlone,
    KSTProtectionClass protectionClass = kKSTProtectionClassLeaveAlone) {
  KSTErrorRef error;
  if (!KSTFileManager::defaultManager().createDirectoryAtURL(url, parents, 0755, owner,
                                                             protectionClass, &error)) {
    KSTLogTag(kLogError, tag, failureMessage, url, error);
  }
  return url;
}

// The class of the directories whose contents stay readable while the device
// is locked (the caches, library and log directories).
inline constexpr KSTProtectionClass kKSTLayoutDirectoryProtectionClass{4};

}  // namespace kestrel
