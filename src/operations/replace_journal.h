// The journal of one replace in flight: the four directories it moves
// between, kept in "<operation id>.plist" in the Replace directory from
// before the first move until the swap is done or undone.
#pragma once

#include <string>

#include "platform/plist.h"
#include "store/file_url.h"

namespace kestrel {

inline constexpr const char* kKSTReplaceOperationOldURLKey = "KSTReplaceOperationOldURL";
inline constexpr const char* kKSTReplaceOperationNewURLKey = "KSTReplaceOperationNewURL";
inline constexpr const char* kKSTReplaceOperationStagingURLKey = "KSTReplaceOperationStagingURL";
inline constexpr const char* kKSTReplaceOperationDestURLKey = "KSTReplaceOperationDestURL";

struct KSTReplaceJournal {
  KSTFileURL oldURL;      // the old container's directory
  KSTFileURL newURL;      // the new container's directory before the swap
  KSTFileURL stagingURL;  // where the old container is parked meanwhile
  KSTFileURL destURL;     // where the new container goes

  // The four keys with their paths, as the file holds them.
  PlistDictionary dictionary() const;
  std::string description() const;
};

}  // namespace kestrel
