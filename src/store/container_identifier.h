// What a container identifier may be. Identifiers arrive from clients and end
// up in metadata files, lock keys, log lines and the sandbox's tables, so the
// store refuses the ones that cannot name anything sensibly.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace kestrel {

// Longer than any bundle, group or system identifier has reason to be.
inline constexpr std::size_t kKSTMaxIdentifierLength = 1024;

// Not empty, at most kKSTMaxIdentifierLength bytes, no "/" and no NUL.
bool KSTIdentifierIsUsable(std::string_view identifier);

// The identifier as log lines show it: identifiers come from clients and may
// be of any length, so a long one is cut to a bounded prefix and its size.
std::optional<std::string> KSTIdentifierForLog(const std::optional<std::string>& identifier);

}  // namespace kestrel
