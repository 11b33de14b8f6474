// A container directory is a container only through the hidden property list
// ".com.zorvane.kestrel.metadata.plist" inside it, which says whose container
// it is. KSTMetadata is the in-memory record of one container: read from that
// file (and checked before it is believed) and written back to it.
//
// File keys: "KSTMetadataIdentifier" (string), "KSTMetadataUUID" (the internal
// UUID's upper-case text), "KSTMetadataContentClass" (unsigned), and
// "KSTMetadataPersona" (unsigned, the owning user; older files lack it) and
// "KSTMetadataInfo" (dictionary, only when there is info). Other keys are
// ignored.
//
// A record is shared: the cache hands out the object it keeps, so every field
// that can change is guarded here and may be read and set from any thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "daemon/errors.h"
#include "platform/plist.h"
#include "platform/uuid.h"
#include "store/container_class.h"
#include "store/file_url.h"

namespace kestrel {

inline constexpr const char* kKSTMetadataFileName = ".com.zorvane.kestrel.metadata.plist";

inline constexpr const char* kKSTMetadataIdentifierKey = "KSTMetadataIdentifier";
inline constexpr const char* kKSTMetadataUUIDKey = "KSTMetadataUUID";
inline constexpr const char* kKSTMetadataContentClassKey = "KSTMetadataContentClass";
inline constexpr const char* kKSTMetadataPersonaKey = "KSTMetadataPersona";
inline constexpr const char* kKSTMetadataInfoKey = "KSTMetadataInfo";

class KSTMetadata {
 public:
  // A record whose transient and existed flags are false.
  static std::shared_ptr<KSTMetadata> initWithUserId(std::uint32_t userId, platform::Uuid uuid,
                                                     KSTContainerClass containerClass,
                                                     std::string identifier,
                                                     std::optional<PlistDictionary> info,
                                                     KSTFileURL url);
  KSTMetadata(std::uint32_t userId, platform::Uuid uuid, KSTContainerClass containerClass,
              std::string identifier, std::optional<PlistDictionary> info, KSTFileURL url);

  KSTMetadata(const KSTMetadata&) = delete;
  KSTMetadata& operator=(const KSTMetadata&) = delete;

  // Reads the metadata file of the container directory at url and checks it:
  // its identifier, UUID and class, that it belongs to forUser, its info and,
  // with checkClassPath, that the container lies in the directory of the class
  // the file names. The first failure gives nullptr with error 12 (unreadable,
  // or not a dictionary) or 29 (anything else), logged. The record's uid is
  // forUser and its url the container directory.
  static std::shared_ptr<KSTMetadata> readAndValidateMetadataAtUrl(const KSTFileURL& url,
                                                                   std::uint32_t forUser,
                                                                   bool checkClassPath,
                                                                   KSTErrorRef* error);

  // Writes the record to <url>/.com.zorvane.kestrel.metadata.plist as a binary
  // property list, atomically and in protection class none. Error 34 (logged,
  // with the writer's error beneath it) on failure; the old file then stays.
  bool writeMetadataToDiskWithError(KSTErrorRef* error) const;

  // The metadata file of the container directory at url.
  static KSTFileURL metadataFileURL(const KSTFileURL& containerURL) {
    return containerURL.appending(kKSTMetadataFileName);
  }

  KSTContainerClass containerClass() const { return containerClass_; }
  const std::string& identifier() const { return identifier_; }

  std::uint32_t uid() const;
  void setUid(std::uint32_t uid);
  void setUserId(std::uint32_t userId) { setUid(userId); }
  platform::Uuid uuid() const;
  void setUuid(const platform::Uuid& uuid);
  std::optional<PlistDictionary> info() const;
  void setInfo(std::optional<PlistDictionary> info);
  // The container directory (not the file).
  KSTFileURL url() const;
  void setUrl(KSTFileURL url);

  // Whether the container lives in a transient location. Not in the file.
  bool transient() const { return transient_.load(std::memory_order_relaxed); }
  void setTransient(bool transient) { transient_.store(transient, std::memory_order_relaxed); }
  // Set by lookup: found (true) or made now (false). Not in the file.
  bool existed() const { return existed_.load(std::memory_order_relaxed); }
  void setExisted(bool existed) { existed_.store(existed, std::memory_order_relaxed); }

  // "<KSTMetadata: identifier class uuid at path>", for log texts.
  std::string description() const;

 private:
  const KSTContainerClass containerClass_;
  const std::string identifier_;

  mutable std::mutex mutex_;  // Guards the fields below.
  std::uint32_t uid_;
  platform::Uuid uuid_;
  std::optional<PlistDictionary> info_;
  KSTFileURL url_;

  std::atomic<bool> transient_{false};
  std::atomic<bool> existed_{false};
};

using KSTMetadataRef = std::shared_ptr<KSTMetadata>;

}  // namespace kestrel
