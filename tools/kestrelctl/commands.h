// The named subcommands of kestrelctl: which daemon command each one sends,
// which options it takes, and how its request is built from them.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/message_ipc.h"
#include "platform/plist.h"
#include "platform/uuid.h"

namespace kestrel::kestrelctl {

enum class Subcommand {
  Create,
  Lookup,
  List,
  Sweep,
  SystemContainer,
  CodeSigningInfo,
  InvalidateCodeSigning,
  InfoGet,
  InfoSet,
  InfoRemove,
  Metadata,
  SetProtectionClass,
  Repair,
  NewUuid,
  Usage,
};

// What a subcommand accepts on the command line (bit set).
enum SubcommandOption : unsigned {
  kOptionClass = 1u << 0,               // --class, required
  kOptionUser = 1u << 1,                // --user, required
  kOptionIdentifier = 1u << 2,          // --identifier, optional
  kOptionIdentifierRequired = 1u << 3,  // --identifier, required
  kOptionTransient = 1u << 4,           // --transient
  // --uuid, the container's UUID; without it the container is looked up
  // first (class, user, identifier) and its UUID and identifier are used.
  kOptionUUID = 1u << 5,
  kOptionKey = 1u << 6,             // --key, required
  kOptionValue = 1u << 7,           // --value (JSON), required
  kOptionInfoDictionary = 1u << 8,  // --info
  kOptionProtectionClass =
      1u << 9,  // --protection-class (required), --third-party, --retry-if-locked
};

struct SubcommandInfo {
  Subcommand subcommand;
  std::string_view name;
  std::uint64_t command;  // the daemon's command index
  unsigned options;       // SubcommandOption bits
  std::string_view summary;

  bool takes(SubcommandOption option) const { return (options & option) != 0; }
};

// Every named subcommand, in the order the help lists them.
std::span<const SubcommandInfo> subcommands();
const SubcommandInfo& subcommandInfo(Subcommand subcommand);

// The options given for a named subcommand, already parsed.
struct RequestOptions {
  std::optional<std::uint64_t> containerClass;
  std::optional<std::uint64_t> userId;
  std::optional<std::string> identifier;
  bool transient = false;
  std::optional<platform::Uuid> uuid = std::nullopt;
  std::optional<std::string> key = std::nullopt;
  std::optional<PlistValue> value = std::nullopt;
  bool infoDictionary = false;
  std::optional<std::int64_t> protectionClass = std::nullopt;
  bool thirdParty = false;
  bool retryIfLocked = false;
};

// The request for the subcommand: "Command" plus the keys it sends. An
// identifier that is not given is left out, so that the daemon uses the
// client's own. False, with a message, when a required option is missing
// (the UUID included: the caller looks the container up first).
bool buildRequest(const SubcommandInfo& info, const RequestOptions& options,
                  platform::MessageDictionary* request, std::string* error);

// A decimal number in 0..2^64-1. Nothing, with a message naming the option,
// for anything else (signs, blanks, overflow).
std::optional<std::uint64_t> parseUnsignedOption(std::string_view option, std::string_view text,
                                                 std::string* error);

// A container class given as its number (any uint64, so that the daemon's own
// answer to 0 or 14 can be seen) or as its path name, e.g. "Data/Application"
// (letter case ignored). Nothing, with a message, for anything else.
std::optional<std::uint64_t> parseContainerClass(std::string_view text, std::string* error);

// The path names of the classes 1 to 13, index 0 holding class 1.
std::span<const std::string_view> containerClassNames();

}  // namespace kestrel::kestrelctl
