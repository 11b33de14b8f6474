#include "codesigning/code_signing_entry.h"

#include <functional>

#include "platform/format.h"

namespace kestrel {
namespace {

std::size_t combine(std::size_t seed, std::size_t value) {
  return seed ^ (value + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2));
}

PlistArray childrenAsArray(const std::vector<std::string>& children) {
  return PlistArray(children.begin(), children.end());
}

}  // namespace

std::size_t KSTPlistValueHash(const PlistValue& value) {
  using Type = PlistValue::Type;
  switch (value.type()) {
    case Type::Dictionary: {
      std::size_t seed = 0x64;
      for (const auto& [key, member] : *value.dictionary()) {
        seed = combine(seed, std::hash<std::string>{}(key));
        seed = combine(seed, KSTPlistValueHash(member));
      }
      return seed;
    }
    case Type::Array: {
      std::size_t seed = 0x61;
      for (const auto& element : *value.array()) seed = combine(seed, KSTPlistValueHash(element));
      return seed;
    }
    case Type::String:
      return std::hash<std::string>{}(*value.string());
    case Type::Integer:
    case Type::UnsignedInteger: {
      // A signed and an unsigned integer of the same value are equal, so both
      // hash the same bits.
      const auto asSigned = value.signedInteger();
      const std::uint64_t bits =
          asSigned ? static_cast<std::uint64_t>(*asSigned) : value.unsignedInteger().value_or(0);
      return std::hash<std::uint64_t>{}(bits);
    }
    case Type::Real:
      return std::hash<double>{}(value.real().value_or(0));
    case Type::Boolean:
      return value.boolean().value_or(false) ? 1 : 0;
    case Type::Data: {
      std::size_t seed = 0x44;
      for (auto byte : *value.data()) seed = combine(seed, byte);
      return seed;
    }
    case Type::Date:
      return std::hash<double>{}(value.date()->secondsSinceReferenceDate);
  }
  return 0;
}

KSTCodeSigningEntry::KSTCodeSigningEntry(std::optional<PlistDictionary> codeSigningInfo,
                                         KSTContainerClass dataContainerClass)
    : codeSigningInfo_(std::move(codeSigningInfo)), dataContainerClass_(dataContainerClass) {}

KSTCodeSigningEntry KSTCodeSigningEntry::initWithSerializedDictionary(
    const PlistDictionary& serialized) {
  KSTCodeSigningEntry entry;
  auto member = [&](const char* key) -> const PlistValue* {
    auto it = serialized.find(key);
    return it == serialized.end() ? nullptr : &it->second;
  };
  if (const PlistValue* info = member(kKSTSerializedCodeSigningInfoKey);
      info != nullptr && info->isDictionary()) {
    entry.codeSigningInfo_ = *info->dictionary();
  }
  if (const PlistValue* children = member(kKSTSerializedChildBundleIdsKey);
      children != nullptr && children->isArray()) {
    std::vector<std::string> identifiers;
    for (const auto& child : *children->array()) {
      if (child.isString()) identifiers.push_back(*child.string());
    }
    entry.childBundleIdentifiers_ = std::move(identifiers);
  }
  auto flag = [&](const char* key) {
    const PlistValue* value = member(key);
    return value != nullptr && value->boolean().value_or(false);
  };
  entry.invalid_ = flag(kKSTSerializedInvalidKey);
  entry.placeholder_ = flag(kKSTSerializedPlaceholderKey);
  entry.registeredByCaller_ = flag(kKSTSerializedRegisteredByCallerKey);
  if (const PlistValue* dataClass = member(kKSTSerializedDataContainerClassKey)) {
    entry.dataContainerClass_ = dataClass->unsignedInteger().value_or(kKSTContainerClassUndefined);
  }
  return entry;
}

PlistDictionary KSTCodeSigningEntry::serialize() const {
  PlistDictionary serialized;
  if (codeSigningInfo_) serialized[kKSTSerializedCodeSigningInfoKey] = *codeSigningInfo_;
  if (childBundleIdentifiers_) {
    serialized[kKSTSerializedChildBundleIdsKey] = childrenAsArray(*childBundleIdentifiers_);
  }
  serialized[kKSTSerializedInvalidKey] = invalid_;
  serialized[kKSTSerializedPlaceholderKey] = placeholder_;
  serialized[kKSTSerializedRegisteredByCallerKey] = registeredByCaller_;
  serialized[kKSTSerializedDataContainerClassKey] = static_cast<std::uint64_t>(dataContainerClass_);
  return serialized;
}

bool KSTCodeSigningEntry::isEqual(const KSTCodeSigningEntry& other) const {
  if (this == &other) return true;
  return codeSigningInfo_ == other.codeSigningInfo_ &&
         childBundleIdentifiers_ == other.childBundleIdentifiers_ && invalid_ == other.invalid_ &&
         placeholder_ == other.placeholder_ && registeredByCaller_ == other.registeredByCaller_ &&
         dataContainerClass_ == other.dataContainerClass_;
}

std::size_t KSTCodeSigningEntry::hash() const {
  const std::size_t infoHash =
      codeSigningInfo_ ? KSTPlistValueHash(PlistValue(*codeSigningInfo_)) : 0;
  const std::size_t childrenHash =
      childBundleIdentifiers_
          ? KSTPlistValueHash(PlistValue(childrenAsArray(*childBundleIdentifiers_)))
          : 0;
  return (infoHash ^ childrenHash) + (invalid_ ? 2 : 0) + (placeholder_ ? 4 : 0) +
         (registeredByCaller_ ? 8 : 0) + (dataContainerClass_ != 0 ? 16 : 0);
}

std::string KSTCodeSigningEntry::description() const {
  const std::optional<PlistValue> children =
      childBundleIdentifiers_ ? std::optional<PlistValue>(childrenAsArray(*childBundleIdentifiers_))
                              : std::nullopt;
  const std::optional<PlistValue> info =
      codeSigningInfo_ ? std::optional<PlistValue>(*codeSigningInfo_) : std::nullopt;
  return formatMessage(
      "<%@ invalid: %c, placeholder: %c, regByCaller: %c, dataClass: %llu, childBundles: %@, "
      "CSinfo: %@>",
      "KSTCodeSigningEntry", invalid_ ? 'Y' : 'N', placeholder_ ? 'Y' : 'N',
      registeredByCaller_ ? 'Y' : 'N', static_cast<unsigned long long>(dataContainerClass_),
      children, info);
}

}  // namespace kestrel
