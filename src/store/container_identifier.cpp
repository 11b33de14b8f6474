#include "store/container_identifier.h"

namespace kestrel {

bool KSTIdentifierIsUsable(std::string_view identifier) {
  if (identifier.empty() || identifier.size() > kKSTMaxIdentifierLength) return false;
  return identifier.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

}  // namespace kestrel
