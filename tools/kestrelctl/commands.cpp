#include "commands.h"

#include <array>
#include <charconv>

namespace kestrel::kestrelctl {

namespace {

constexpr std::array kSubcommands{
    SubcommandInfo{Subcommand::Create, "create", 0,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionTransient,
                   "Create a container, or look up the one that exists"},
    SubcommandInfo{Subcommand::Lookup, "lookup", 0,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionTransient,
                   "Look up an existing container"},
    SubcommandInfo{Subcommand::List, "list", 1, kOptionClass | kOptionUser | kOptionTransient,
                   "List the containers of a class for a user"},
    SubcommandInfo{Subcommand::Sweep, "sweep", 4, 0, "Sweep death row"},
    SubcommandInfo{Subcommand::SystemContainer, "system-container", 15, kOptionIdentifier,
                   "Create or look up a system container"},
    SubcommandInfo{Subcommand::CodeSigningInfo, "code-signing-info", 19, kOptionIdentifierRequired,
                   "Show the code-signing information recorded for an identifier"},
    SubcommandInfo{Subcommand::InvalidateCodeSigning, "invalidate-code-signing", 20, 0,
                   "Drop code-signing information of apps without a bundle container"},
    SubcommandInfo{Subcommand::InfoGet, "info-get", 6,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID | kOptionKey,
                   "Show one info value of a container"},
    SubcommandInfo{
        Subcommand::InfoSet, "info-set", 5,
        kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID | kOptionKey | kOptionValue,
        "Set one info value of a container (the value as JSON)"},
    SubcommandInfo{Subcommand::InfoRemove, "info-remove", 5,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID | kOptionKey,
                   "Remove one info value of a container"},
    SubcommandInfo{
        Subcommand::Metadata, "metadata", 7,
        kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID | kOptionInfoDictionary,
        "Show a container's metadata: path, transient, and its info with --info"},
    SubcommandInfo{Subcommand::SetProtectionClass, "set-protection-class", 21,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionProtectionClass,
                   "Move a data container's files to another data-protection class"},
    SubcommandInfo{
        Subcommand::Repair, "repair", 8,
        kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID,
        "Put back a container's default sub-directories (and a system container's ACLs)"},
    SubcommandInfo{Subcommand::NewUuid, "new-uuid", 9,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID,
                   "Move a container to a new directory UUID; its identity stays"},
    SubcommandInfo{Subcommand::Usage, "usage", 23,
                   kOptionClass | kOptionUser | kOptionIdentifier | kOptionUUID,
                   "Show the storage a container's files take"},
};

// Kept here rather than linking the daemon's logic into the tool; the tests
// hold it to KSTContainerClassPath.
constexpr std::array<std::string_view, 13> kClassNames{
    "Bundle/Application", "Data/Application",    "Bundle/VantlerPlugin", "Data/VantlerPlugin",
    "Bundle/VPNPlugin",   "Data/VPNPlugin",      "Shared/AppGroup",      "Bundle/Framework",
    "Data/VexelService",  "Data/InternalDaemon", "Data/TempDir",         "Data/System",
    "Shared/SystemGroup",
};

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    const auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? char(c - 'A' + 'a') : c; };
    if (lower(a[i]) != lower(b[i])) return false;
  }
  return true;
}

bool isDigits(std::string_view text) {
  if (text.empty()) return false;
  for (char c : text) {
    if (c < '0' || c > '9') return false;
  }
  return true;
}

}  // namespace

std::span<const SubcommandInfo> subcommands() {
  return kSubcommands;
}

const SubcommandInfo& subcommandInfo(Subcommand subcommand) {
  for (const SubcommandInfo& info : kSubcommands) {
    if (info.subcommand == subcommand) return info;
  }
  return kSubcommands.front();  // not reached: every enumerator has a row
}

std::span<const std::string_view> containerClassNames() {
  return kClassNames;
}

bool buildRequest(const SubcommandInfo& info, const RequestOptions& options,
                  platform::MessageDictionary* request, std::string* error) {
  if (info.takes(kOptionClass) && !options.containerClass) {
    *error = "--class is required";
    return false;
  }
  if (info.takes(kOptionUser) && !options.userId) {
    *error = "--user is required";
    return false;
  }
  if (info.takes(kOptionIdentifierRequired) && !options.identifier) {
    *error = "--identifier is required";
    return false;
  }
  if (info.takes(kOptionUUID) && !options.uuid) {
    *error = "--uuid is required";
    return false;
  }
  if (info.takes(kOptionKey) && !options.key) {
    *error = "--key is required";
    return false;
  }
  if (info.takes(kOptionValue) && !options.value) {
    *error = "--value is required";
    return false;
  }
  if (info.takes(kOptionProtectionClass) && !options.protectionClass) {
    *error = "--protection-class is required";
    return false;
  }

  *request = platform::MessageDictionary();
  request->setUint64("Command", info.command);
  if (info.takes(kOptionClass)) request->setUint64("ContainerClass", *options.containerClass);
  if (info.takes(kOptionUser)) request->setUint64("UserID", *options.userId);
  if ((info.takes(kOptionIdentifier) || info.takes(kOptionIdentifierRequired)) &&
      options.identifier) {
    request->setString("Identifier", *options.identifier);
  }
  if (info.subcommand == Subcommand::Create || info.subcommand == Subcommand::Lookup) {
    request->setBoolean("CreateIfNecessary", info.subcommand == Subcommand::Create);
  }
  if (info.takes(kOptionTransient)) request->setBoolean("Transient", options.transient);
  if (info.takes(kOptionUUID)) request->setUuid("UUID", *options.uuid);
  if (info.takes(kOptionKey)) request->setString("Key", *options.key);
  if (info.takes(kOptionValue) && !request->setPlist("Value", *options.value)) {
    *error = "--value is nested too deep";
    return false;
  }
  if (info.takes(kOptionInfoDictionary)) {
    request->setBoolean("InfoDictRequested", options.infoDictionary);
  }
  if (info.takes(kOptionProtectionClass)) {
    request->setInt64("DataProtectionClass", *options.protectionClass);
    request->setBoolean("IsThirdParty", options.thirdParty);
    request->setBoolean("RetryIfLocked", options.retryIfLocked);
  }
  return true;
}

std::optional<std::uint64_t> parseUnsignedOption(std::string_view option, std::string_view text,
                                                 std::string* error) {
  std::uint64_t value = 0;
  if (isDigits(text)) {
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec == std::errc() && end == text.data() + text.size()) return value;
  }
  *error = std::string(option) + ": \"" + std::string(text) +
           "\" is not a number between 0 and 18446744073709551615";
  return std::nullopt;
}

std::optional<std::uint64_t> parseContainerClass(std::string_view text, std::string* error) {
  if (!text.empty() && (isDigits(text.substr(0, 1)) || text[0] == '-' || text[0] == '+')) {
    return parseUnsignedOption("--class", text, error);
  }
  for (std::size_t i = 0; i < kClassNames.size(); ++i) {
    if (equalsIgnoringCase(text, kClassNames[i])) return i + 1;
  }
  std::string known;
  for (std::string_view name : kClassNames) {
    known += known.empty() ? "" : ", ";
    known += name;
  }
  *error = "--class: unknown container class \"" + std::string(text) +
           "\" (give a number or one of " + known + ")";
  return std::nullopt;
}

}  // namespace kestrel::kestrelctl
