#include "store/container_identifier.h"

namespace kestrel {

bool KSTIdentifierIsUsable(std::string_view identifier) {
  if (identifier.empty() || identifier.size() > kKSTMaxIdentifierLength) return false;
  return identifier.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::optional<std::string> KSTIdentifierForLog(const std::optional<std::string>& identifier) {
  constexpr std::size_t kShown = 64;
  if (!identifier || identifier->size() <= kKSTMaxIdentifierLength) return identifier;
  return identifier->substr(0, kShown) + "... (" + std::to_string(identifier->size()) + " bytes)";
}

}  // namespace kestrel
