// KSTWhitelist: the system containers (class 12) and system group containers
// (class 13) that the daemon knows by name. Such a container lives in the
// directory named in the table, under its class directory, instead of under a
// random UUID; and a client may reach it without the entitlement that would
// otherwise be needed. Identifiers are compared exactly (case-sensitive, whole
// string).
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "store/container_class.h"

namespace kestrel {

class KSTWhitelist {
 public:
  // Identifier → last path component of the container's directory.
  using Mapping = std::map<std::string, std::string, std::less<>>;

  // The one whitelist of the process, built with the fixed tables on first use.
  static const KSTWhitelist& sharedWhitelist();

  KSTWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping);

  // System containers (class 12, "Data/System").
  std::optional<std::string> wellknownSystemContainerForId(std::string_view identifier) const;
  bool systemContainerIdIsWellknown(std::string_view identifier) const;
  std::vector<std::string> wellknownSystemContainers() const;

  // System group containers (class 13, "Shared/SystemGroup").
  std::optional<std::string> wellknownSystemGroupContainerForId(std::string_view identifier) const;
  bool systemGroupContainerIdIsWellknown(std::string_view identifier) const;
  std::vector<std::string> wellknownSystemGroupContainers() const;

  // By class: 12 asks the system-container table, 13 the system-group table;
  // every other class knows no identifier.
  bool containerIdIsWellknown(std::string_view identifier, KSTContainerClass containerClass) const;
  std::optional<std::string> wellknownContainerForId(std::string_view identifier,
                                                     KSTContainerClass containerClass) const;

  const Mapping& systemWhitelist() const { return systemWhitelist_; }
  const Mapping& systemGroupWhitelist() const { return systemGroupWhitelist_; }

 private:
  Mapping systemWhitelist_;
  Mapping systemGroupWhitelist_;
};

}  // namespace kestrel
