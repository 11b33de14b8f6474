#include "human_output.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <utility>
#include <vector>

#include "daemon/error_codes.h"

namespace kestrel::kestrelctl {

namespace {

using platform::MessageDictionary;
using platform::MessageValue;

constexpr std::string_view kAbsent = "-";

struct CodeName {
  std::uint64_t code;
  std::string_view name;
};

constexpr std::array kCodeNames{
    CodeName{kKSTSuccess, "success"},
    CodeName{kKSTErrorMoveToTempFailed, "move to temporary directory failed"},
    CodeName{kKSTErrorRemoveTransientFailed, "removing transient container failed"},
    CodeName{kKSTErrorCreateSubdirectoryFailed, "creating subdirectory failed"},
    CodeName{kKSTErrorCreateStagingFailed, "creating staging directory failed"},
    CodeName{kKSTErrorMoveStagingFailed, "moving staging directory failed"},
    CodeName{kKSTErrorRemoveStagingFailed, "removing staging directory failed"},
    CodeName{kKSTErrorInvalidURL, "invalid path"},
    CodeName{kKSTErrorInvalidObject, "invalid object"},
    CodeName{kKSTErrorMetadataReadFailed, "reading metadata failed"},
    CodeName{kKSTErrorReplaceStagingFailed, "staging the replacement failed"},
    CodeName{kKSTErrorReplaceFailed, "replace failed"},
    CodeName{kKSTErrorDestroyFailed, "destroy failed"},
    CodeName{kKSTErrorMissingIdentifier, "missing identifier"},
    CodeName{kKSTErrorNotFound, "not found"},
    CodeName{kKSTErrorReplaceSameContainer, "replacing a container with itself"},
    CodeName{kKSTErrorClassMismatch, "class mismatch"},
    CodeName{kKSTErrorInfoValueNotFound, "info value not found"},
    CodeName{kKSTErrorAlreadyExists, "already exists"},
    CodeName{kKSTErrorDeleteFailed, "delete failed"},
    CodeName{kKSTErrorInvalidMetadata, "invalid metadata"},
    CodeName{kKSTErrorInvalidReplaceInfo, "invalid replace information"},
    CodeName{kKSTErrorWriteFailed, "write failed"},
    CodeName{kKSTErrorReplaceRecoveryFailed, "replace recovery failed"},
    CodeName{kKSTErrorReplaceCleanupFailed, "replace clean-up failed"},
    CodeName{kKSTErrorInvalidParameter, "invalid parameter"},
    CodeName{kKSTErrorException, "internal exception"},
    CodeName{kKSTErrorDeathRowMoveFailed, "move to death row failed"},
    CodeName{kKSTErrorCacheRebuildFailed, "cache rebuild failed"},
    CodeName{kKSTErrorCacheInconsistent, "cache inconsistent"},
    CodeName{kKSTErrorCacheAddFailed, "adding to the cache failed"},
    CodeName{kKSTErrorCacheRemoveFailed, "removing from the cache failed"},
    CodeName{kKSTErrorCacheInvalidInput, "invalid cache input"},
    CodeName{kKSTErrorRegenerateUUIDFailed, "regenerating the UUID failed"},
    CodeName{kKSTErrorInvalidCommand, "invalid command"},
    CodeName{kKSTErrorNotEntitled, "not entitled"},
    CodeName{kKSTErrorUserMismatch, "user mismatch"},
    CodeName{kKSTErrorMappingWriteFailed, "writing the code-signing mapping failed"},
    CodeName{kKSTErrorMappingInvalidInput, "invalid code-signing input"},
    CodeName{kKSTErrorDeviceLocked, "device locked"},
    CodeName{kKSTErrorChangeOwnerFailed, "changing the owner failed"},
    CodeName{kKSTErrorACLFailed, "setting the ACL failed"},
    CodeName{kKSTErrorSharedContentMoveFailed, "moving shared content failed"},
};

using Facts = std::vector<std::pair<std::string, std::string>>;

// "key  value" lines, the values lined up two columns after the longest key.
std::string renderFacts(const Facts& facts, std::size_t indent = 0) {
  std::size_t width = 0;
  for (const auto& [key, value] : facts) width = std::max(width, key.size());
  std::string out;
  for (const auto& [key, value] : facts) {
    out.append(indent, ' ');
    out += key;
    if (!value.empty()) {
      out.append(width - key.size() + 2, ' ');
      out += value;
    }
    out += '\n';
  }
  return out;
}

std::string stringOrAbsent(const std::optional<std::string>& value) {
  return value ? *value : std::string(kAbsent);
}

std::string uuidOrAbsent(const std::optional<platform::Uuid>& value) {
  return value ? value->string() : std::string(kAbsent);
}

std::string hex(const platform::MessageData& data) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string out;
  for (std::uint8_t byte : data) {
    out += kDigits[byte >> 4];
    out += kDigits[byte & 15];
  }
  return out;
}

// A scalar as one word; nothing for arrays and dictionaries, which take lines.
std::optional<std::string> scalarText(const MessageValue& value) {
  using Type = MessageValue::Type;
  switch (value.type()) {
    case Type::Uint64:
      return std::to_string(*value.uint64());
    case Type::Int64:
      return std::to_string(*value.int64());
    case Type::Boolean:
      return std::string(*value.boolean() ? "true" : "false");
    case Type::String:
      return *value.string();
    case Type::Double: {
      char buffer[32];
      std::snprintf(buffer, sizeof buffer, "%g", *value.real());
      return std::string(buffer);
    }
    case Type::Data:
      return hex(*value.data());
    case Type::Array:
      if (value.array()->empty()) return std::string("(empty)");
      return std::nullopt;
    case Type::Dictionary:
      if (value.dictionary()->empty()) return std::string("(empty)");
      return std::nullopt;
  }
  return std::nullopt;
}

void renderValue(const MessageValue& value, std::size_t indent, std::string* out);

void renderDictionary(const MessageDictionary& dictionary, std::size_t indent, std::string* out) {
  // Runs of scalars line up as facts; a nested value follows its key indented.
  Facts facts;
  for (const auto& [key, value] : dictionary.entries()) {
    if (auto text = scalarText(value)) {
      facts.emplace_back(key, *text);
      continue;
    }
    *out += renderFacts(facts, indent);
    facts.clear();
    out->append(indent, ' ');
    *out += key + "\n";
    renderValue(value, indent + 2, out);
  }
  *out += renderFacts(facts, indent);
}

void renderValue(const MessageValue& value, std::size_t indent, std::string* out) {
  if (const MessageDictionary* dictionary = value.dictionary()) {
    renderDictionary(*dictionary, indent, out);
  } else if (const platform::MessageArray* array = value.array()) {
    for (const MessageValue& element : *array) {
      out->append(indent, ' ');
      if (auto text = scalarText(element)) {
        *out += "- " + *text + "\n";
      } else {
        *out += "-\n";
        renderValue(element, indent + 2, out);
      }
    }
  } else if (auto text = scalarText(value)) {
    out->append(indent, ' ');
    *out += *text + "\n";
  }
}

std::string renderContainer(const MessageDictionary& reply) {
  const MessageValue* existed = reply.value("ReplyExisted");
  return renderFacts({
      {"identifier", stringOrAbsent(reply.string("ReplyIdentifier"))},
      {"path", stringOrAbsent(reply.string("ReplyPath"))},
      {"uuid", uuidOrAbsent(reply.uuid("ReplyUUID"))},
      {"existed",
       existed && existed->boolean() ? (*existed->boolean() ? "yes" : "no") : std::string(kAbsent)},
  });
}

std::string renderList(const MessageDictionary& reply) {
  static const platform::MessageArray kNone;
  const platform::MessageArray* identifiers = reply.array("ReplyIdsArray");
  const platform::MessageArray* uuids = reply.array("ReplyUUIDsArray");
  if (!identifiers) identifiers = &kNone;
  if (!uuids) uuids = &kNone;
  // The two arrays pair up entry by entry; a longer one still shows in full.
  const std::size_t count = std::max(identifiers->size(), uuids->size());
  const auto identifierAt = [&](std::size_t i) {
    const std::string* text = i < identifiers->size() ? (*identifiers)[i].string() : nullptr;
    return text ? *text : std::string(kAbsent);
  };
  const auto uuidAt = [&](std::size_t i) {
    const auto uuid = i < uuids->size() ? (*uuids)[i].uuid() : std::nullopt;
    return uuidOrAbsent(uuid);
  };

  std::string out;
  if (count > 0) {
    Facts rows{{"IDENTIFIER", "UUID"}};
    for (std::size_t i = 0; i < count; ++i) rows.emplace_back(identifierAt(i), uuidAt(i));
    out = renderFacts(rows);
  }
  out += std::to_string(count) + (count == 1 ? " container\n" : " containers\n");
  return out;
}

std::string renderCodeSigningInfo(const MessageDictionary& reply) {
  const MessageDictionary* info = reply.dictionary("ReplyInfoDictionary");
  if (!info) return std::string(kAbsent) + "\n";
  if (info->empty()) return "(empty)\n";
  std::string out;
  renderDictionary(*info, 0, &out);
  return out;
}

std::string renderInfoValue(const MessageDictionary& reply) {
  const MessageValue* value = reply.value("ReplyInfoValue");
  if (!value) return std::string(kAbsent) + "\n";
  std::string out;
  renderValue(*value, 0, &out);
  return out;
}

std::string renderMetadata(const MessageDictionary& reply) {
  const MessageValue* transient = reply.value("ReplyTransient");
  std::string out = renderFacts({
      {"path", stringOrAbsent(reply.string("ReplyPath"))},
      {"transient", transient && transient->boolean() ? (*transient->boolean() ? "yes" : "no")
                                                      : std::string(kAbsent)},
  });
  if (const MessageDictionary* info = reply.dictionary("ReplyInfoDictionary")) {
    if (info->empty()) return out + "info  (empty)\n";
    out += "info\n";
    renderDictionary(*info, 2, &out);
  }
  return out;
}

std::string renderUsage(const MessageDictionary& reply) {
  const MessageValue* usage = reply.value("ReplyDiskUsage");
  if (!usage || !usage->uint64()) return renderFacts({{"usage", std::string(kAbsent)}});
  const std::uint64_t bytes = *usage->uint64();
  return renderFacts({{"usage", humanBytes(bytes)}, {"bytes", std::to_string(bytes)}});
}

}  // namespace

std::string humanBytes(std::uint64_t bytes) {
  static constexpr const char* kUnits[] = {"KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
  if (bytes < 1024) return std::to_string(bytes) + " B";
  double value = static_cast<double>(bytes) / 1024;
  std::size_t unit = 0;
  // Rounded to one decimal, 1023.95 KiB shows as 1.0 MiB rather than 1024.0 KiB.
  while (value >= 1023.95 && unit + 1 < std::size(kUnits)) {
    value /= 1024;
    ++unit;
  }
  char text[32];
  std::snprintf(text, sizeof text, "%.1f %s", value, kUnits[unit]);
  return text;
}

std::string renderReply(Subcommand subcommand, const MessageDictionary& reply) {
  switch (subcommand) {
    case Subcommand::Create:
    case Subcommand::Lookup:
      return renderContainer(reply);
    case Subcommand::List:
      return renderList(reply);
    case Subcommand::Sweep:
      return "death row swept\n";
    case Subcommand::SystemContainer:
      return renderFacts({{"path", stringOrAbsent(reply.string("ReplyPath"))}});
    case Subcommand::CodeSigningInfo:
      return renderCodeSigningInfo(reply);
    case Subcommand::InvalidateCodeSigning:
      return "code-signing information invalidated\n";
    case Subcommand::InfoGet:
      return renderInfoValue(reply);
    case Subcommand::InfoSet:
      return "info value set\n";
    case Subcommand::InfoRemove:
      return "info value removed\n";
    case Subcommand::Metadata:
      return renderMetadata(reply);
    case Subcommand::SetProtectionClass:
      return "protection class set\n";
    case Subcommand::Repair:
      return "default structure recreated\n";
    case Subcommand::NewUuid:
      return "container moved to a new directory UUID\n";
    case Subcommand::Usage:
      return renderUsage(reply);
  }
  return {};
}

std::string_view errorCodeName(std::uint64_t code) {
  for (const CodeName& entry : kCodeNames) {
    if (entry.code == code) return entry.name;
  }
  return {};
}

std::string failureMessage(std::string_view subcommand, std::uint64_t code) {
  std::string out =
      "kestrelctl: " + std::string(subcommand) + " failed: error " + std::to_string(code);
  const std::string_view name = errorCodeName(code);
  if (!name.empty()) out += " (" + std::string(name) + ")";
  return out;
}

}  // namespace kestrel::kestrelctl
