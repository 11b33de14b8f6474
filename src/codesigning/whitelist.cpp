#include "codesigning/whitelist.h"

#include <utility>

namespace kestrel {

namespace {

std::optional<std::string> lookUp(const KSTWhitelist::Mapping& mapping,
                                  std::string_view identifier) {
  const auto it = mapping.find(identifier);
  if (it == mapping.end()) return std::nullopt;
  return it->second;
}

std::vector<std::string> keysOf(const KSTWhitelist::Mapping& mapping) {
  std::vector<std::string> keys;
  keys.reserve(mapping.size());
  for (const auto& [identifier, directoryName] : mapping) keys.push_back(identifier);
  return keys;
}

}  // namespace

const KSTWhitelist& KSTWhitelist::sharedWhitelist() {
  // Every identifier is placed in the directory of its own name.
  static const KSTWhitelist whitelist(
      Mapping{
          {"com.zorvane.egretd", "com.zorvane.egretd"},
          {"com.zorvane.ternd", "com.zorvane.ternd"},
      },
      Mapping{
          {"systemgroup.com.zorvane.marten.managed", "systemgroup.com.zorvane.marten.managed"},
          {"systemgroup.com.zorvane.heron.tiles", "systemgroup.com.zorvane.heron.tiles"},
          {"systemgroup.com.zorvane.plover.info", "systemgroup.com.zorvane.plover.info"},
          {"systemgroup.com.zorvane.ibis.profiles", "systemgroup.com.zorvane.ibis.profiles"},
      });
  return whitelist;
}

KSTWhitelist::KSTWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping)
    : systemWhitelist_(std::move(systemContainerMapping)),
      systemGroupWhitelist_(std::move(systemGroupContainerMapping)) {}

std::optional<std::string> KSTWhitelist::wellknownSystemContainerForId(
    std::string_view identifier) const {
  return lookUp(systemWhitelist_, identifier);
}

bool KSTWhitelist::systemContainerIdIsWellknown(std::string_view identifier) const {
  return systemWhitelist_.contains(identifier);
}

std::vector<std::string> KSTWhitelist::wellknownSystemContainers() const {
  return keysOf(systemWhitelist_);
}

std::optional<std::string> KSTWhitelist::wellknownSystemGroupContainerForId(
    std::string_view identifier) const {
  return lookUp(systemGroupWhitelist_, identifier);
}

bool KSTWhitelist::systemGroupContainerIdIsWellknown(std::string_view identifier) const {
  return systemGroupWhitelist_.contains(identifier);
}

std::vector<std::string> KSTWhitelist::wellknownSystemGroupContainers() const {
  return keysOf(systemGroupWhitelist_);
}

bool KSTWhitelist::containerIdIsWellknown(std::string_view identifier,
                                          KSTContainerClass containerClass) const {
  switch (containerClass) {
    case kKSTContainerClassSharedSystemGroup:
      return systemGroupContainerIdIsWellknown(identifier);
    case kKSTContainerClassDataSystem:
      return systemContainerIdIsWellknown(identifier);
    default:
      return false;
  }
}

std::optional<std::string> KSTWhitelist::wellknownContainerForId(
    std::string_view identifier, KSTContainerClass containerClass) const {
  switch (containerClass) {
    case kKSTContainerClassSharedSystemGroup:
      return wellknownSystemGroupContainerForId(identifier);
    case kKSTContainerClassDataSystem:
      return wellknownSystemContainerForId(identifier);
    default:
      return std::nullopt;
  }
}

}  // namespace kestrel
