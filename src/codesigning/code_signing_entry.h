// One identifier's code-signing record: the information that the installer or
// the client handed over, the plug-ins that belong to it, its state flags and
// the class of its data container. A plain value; the mapping store keeps one
// per identifier and persists it in the serialized form below.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist.h"
#include "store/container_class.h"

namespace kestrel {

// Serialized form: keys of one value of the mapping file.
inline constexpr const char* kKSTSerializedCodeSigningInfoKey = "CodeSigningInfo";
inline constexpr const char* kKSTSerializedChildBundleIdsKey = "ChildBundleIds";
inline constexpr const char* kKSTSerializedInvalidKey = "Invalid";
inline constexpr const char* kKSTSerializedPlaceholderKey = "Placeholder";
inline constexpr const char* kKSTSerializedRegisteredByCallerKey = "RegisteredByCaller";
inline constexpr const char* kKSTSerializedDataContainerClassKey = "DataContainerClass";

class KSTCodeSigningEntry {
 public:
  // Every field empty: no info, no children, flags NO, class 0.
  KSTCodeSigningEntry() = default;
  // initWithCodeSigningInfo:andDataContainerClass:
  KSTCodeSigningEntry(std::optional<PlistDictionary> codeSigningInfo,
                      KSTContainerClass dataContainerClass);
  // A value of the wrong type under a key reads as if the key were missing;
  // non-string children are dropped.
  static KSTCodeSigningEntry initWithSerializedDictionary(const PlistDictionary& serialized);

  // Absent info or children leave their key out.
  PlistDictionary serialize() const;

  bool isEqual(const KSTCodeSigningEntry& other) const;
  friend bool operator==(const KSTCodeSigningEntry& a, const KSTCodeSigningEntry& b) {
    return a.isEqual(b);
  }
  std::size_t hash() const;
  std::string description() const;

  const std::optional<PlistDictionary>& codeSigningInfo() const { return codeSigningInfo_; }
  void setCodeSigningInfo(std::optional<PlistDictionary> info) {
    codeSigningInfo_ = std::move(info);
  }
  const std::optional<std::vector<std::string>>& childBundleIdentifiers() const {
    return childBundleIdentifiers_;
  }
  void setChildBundleIdentifiers(std::optional<std::vector<std::string>> children) {
    childBundleIdentifiers_ = std::move(children);
  }
  bool invalid() const { return invalid_; }
  void setInvalid(bool value) { invalid_ = value; }
  bool placeholder() const { return placeholder_; }
  void setPlaceholder(bool value) { placeholder_ = value; }
  bool registeredByCaller() const { return registeredByCaller_; }
  void setRegisteredByCaller(bool value) { registeredByCaller_ = value; }
  KSTContainerClass dataContainerClass() const { return dataContainerClass_; }
  void setDataContainerClass(KSTContainerClass value) { dataContainerClass_ = value; }

 private:
  std::optional<PlistDictionary> codeSigningInfo_;
  std::optional<std::vector<std::string>> childBundleIdentifiers_;
  bool invalid_ = false;
  bool placeholder_ = false;
  bool registeredByCaller_ = false;
  KSTContainerClass dataContainerClass_ = kKSTContainerClassUndefined;
};

// A hash of a property-list value that agrees with its equality: integers hash
// by value whatever their signedness, dictionaries and arrays by their contents.
std::size_t KSTPlistValueHash(const PlistValue& value);

}  // namespace kestrel
