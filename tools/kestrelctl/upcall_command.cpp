#include "upcall_command.h"

#include <algorithm>
#include <charconv>
#include <cstring>

#include "upcall/packbuff.h"
#include "upcall/upcall_items.h"
#include "upcall/upcall_messages.h"

namespace kestrel::kestrelctl {

namespace {

template <typename Number>
std::optional<Number> parseNumber(std::string_view text) {
  Number value = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (ec != std::errc() || end != text.data() + text.size() || text.empty()) return std::nullopt;
  return value;
}

int packString(packbuff* buffer, std::uint16_t valueType, const std::string& text) {
  return sb_packbuff_pack_string(buffer, valueType, text.c_str(), text.size());
}

bool packItem(packbuff* buffer, const std::string& item, std::string* error) {
  const std::size_t equals = item.find('=');
  const std::size_t colon = item.find(':', equals == std::string::npos ? 0 : equals);
  const auto valueType = parseNumber<std::uint16_t>(std::string_view(item).substr(0, equals));
  if (equals == std::string::npos || colon == std::string::npos || !valueType) {
    *error = "an item is <value type>=u32:<number> or <value type>=str:<text>: " + item;
    return false;
  }
  const std::string kind = item.substr(equals + 1, colon - equals - 1);
  const std::string value = item.substr(colon + 1);
  if (kind == "str") return packString(buffer, *valueType, value) == 0;
  const auto number = parseNumber<std::uint32_t>(value);
  if (kind != "u32" || !number) {
    *error = "an item is <value type>=u32:<number> or <value type>=str:<text>: " + item;
    return false;
  }
  return sb_packbuff_pack_uint32(buffer, *valueType, *number) == 0;
}

struct ItemName {
  std::uint16_t valueType;
  const char* text;
  const char* key;  // in JSON
};

constexpr ItemName kItemNames[] = {
    {kKSTUpcallReplyHomeDirectory, "home directory", "HomeDirectory"},
    {kKSTUpcallReplyDataContainer, "data container", "DataContainer"},
    {kKSTUpcallReplyTemporaryDirectory, "temporary directory", "TemporaryDirectory"},
    {kKSTUpcallReplySystemContainer, "system container", "SystemContainer"},
};

const ItemName* nameOf(std::uint16_t valueType) {
  for (const ItemName& name : kItemNames) {
    if (name.valueType == valueType) return &name;
  }
  return nullptr;
}

// The group pairs (key item, then value item) of the reply, by the key's value type.
std::vector<std::pair<std::string, std::string>> pairsOf(const DecodedUpcallReply& reply,
                                                         std::uint16_t keyType,
                                                         std::uint16_t valueType) {
  std::vector<std::pair<std::string, std::string>> pairs;
  for (std::size_t i = 0; i + 1 < reply.items.size(); ++i) {
    const UpcallReplyItem& key = reply.items[i];
    const UpcallReplyItem& value = reply.items[i + 1];
    if (key.valueType == keyType && key.text && value.valueType == valueType && value.text) {
      pairs.emplace_back(*key.text, *value.text);
    }
  }
  return pairs;
}

std::optional<std::uint32_t> statusOf(const DecodedUpcallReply& reply) {
  for (const UpcallReplyItem& item : reply.items) {
    if (item.valueType == kKSTUpcallReplyStatus && item.number) return item.number;
  }
  return std::nullopt;
}

}  // namespace

bool buildUpcallRequest(const UpcallRequestOptions& options, std::vector<std::uint8_t>* datagram,
                        std::string* error) {
  PackbuffRef buffer = sb_packbuff_new(1024);
  if (!buffer) {
    *error = "out of memory";
    return false;
  }
  int failed = 0;
  const auto optionalString = [&](std::uint16_t valueType, const std::optional<std::string>& text) {
    if (text && failed == 0) failed = packString(buffer.get(), valueType, *text);
  };
  optionalString(kKSTUpcallRequestCodeSignatureId, options.signingIdentifier);
  optionalString(kKSTUpcallRequestContainerId, options.containerIdentifier);
  optionalString(kKSTUpcallRequestApplicationId, options.applicationIdentifier);
  if (options.persona && failed == 0) {
    failed = sb_packbuff_pack_uint32(buffer.get(), kKSTUpcallRequestPersonaId, *options.persona);
  }
  if (failed == 0) {
    failed = sb_packbuff_pack_uint32(
        buffer.get(), kKSTUpcallRequestContainerType,
        options.plugin ? kKSTUpcallContainerTypePlugin : kKSTUpcallContainerTypeApplication);
  }
  for (const std::string& group : options.groups) {
    optionalString(kKSTUpcallRequestAppGroupId, group);
  }
  optionalString(kKSTUpcallRequestSystemContainerId, options.systemContainer);
  for (const std::string& group : options.systemGroups) {
    optionalString(kKSTUpcallRequestSystemGroupId, group);
  }
  if (failed != 0) {
    *error = "cannot pack the request: error " + std::to_string(failed);
    return false;
  }
  for (const std::string& item : options.items) {
    if (!packItem(buffer.get(), item, error)) {
      if (error->empty()) *error = "cannot pack " + item;
      return false;
    }
  }
  const std::uint8_t* bytes = sb_packbuff_get_bytes(buffer.get());
  *datagram = KSTUpcallComplexMessage(
      kKSTUpcallSendOnceDisposition, 0, kKSTUpcallProcessContainersId,
      std::span<const std::uint8_t>(bytes, sb_packbuff_get_size(buffer.get())), false);
  return true;
}

std::optional<DecodedUpcallReply> decodeUpcallReply(std::span<const std::uint8_t> datagram,
                                                    std::string* error) {
  const std::optional<KSTUpcallReply> reply = KSTUpcallParseReply(datagram, error);
  if (!reply) return std::nullopt;
  if (reply->id != kKSTUpcallProcessContainersId + kKSTUpcallReplyIdDelta) {
    *error = "a reply to another message (id " + std::to_string(reply->id) + ")";
    return std::nullopt;
  }
  DecodedUpcallReply decoded;
  decoded.returnCode = reply->returnCode;
  if (reply->region.empty()) return decoded;
  // Read from a copy: the reader wants a buffer of its own.
  std::vector<std::uint8_t> region(reply->region.begin(), reply->region.end());
  PackbuffRef buffer =
      sb_packbuff_init_with_buffer(region.data(), region.size(), true, kSBPackbuffDeallocNone);
  std::uint16_t valueType = 0;
  while (buffer && sb_packbuff_get_item_value_type(buffer.get(), &valueType)) {
    UpcallReplyItem item;
    item.valueType = valueType;
    int failed = 0;
    std::uint16_t itemType = 0;
    std::memcpy(&itemType, buffer->item, sizeof itemType);
    if (itemType == kSBPackbuffItemUInt32) {
      item.number = sb_packbuff_unpack_uint32(buffer.get(), &failed);
    } else {
      std::size_t length = 0;
      const char* text = sb_packbuff_unpack_string(buffer.get(), &length, &failed);
      if (failed == 0) item.text = std::string(text, length);
    }
    if (failed != 0) {
      *error = "the reply's item " + std::to_string(decoded.items.size()) +
               " cannot be read: error " + std::to_string(failed);
      return std::nullopt;
    }
    decoded.items.push_back(std::move(item));
  }
  return decoded;
}

std::string upcallReturnCodeText(std::int32_t code) {
  switch (code) {
    case kKSTUpcallAnswered:
      return "answered";
    case kKSTUpcallUnknownValueType:
      return "unknown request item";
    case kKSTUpcallBadRequest:
      return "bad request: unreadable, or not sent by the kernel";
    case kKSTUpcallNoMemory:
      return "no memory";
    case kKSTUpcallTypeError:
      return "malformed message: type error";
    case kKSTUpcallBadId:
      return "malformed message: bad id";
    case kKSTUpcallBadArguments:
      return "malformed message: bad arguments";
    case kKSTUpcallTrailerError:
      return "malformed message: trailer error";
    default:
      return "unknown";
  }
}

std::string renderUpcallReply(const DecodedUpcallReply& reply) {
  std::vector<std::pair<std::string, std::string>> rows;
  for (std::size_t i = 0; i < reply.items.size(); ++i) {
    const UpcallReplyItem& item = reply.items[i];
    const std::string value = item.text ? *item.text : std::to_string(item.number.value_or(0));
    if (item.valueType == kKSTUpcallReplyStatus && item.number) {
      rows.emplace_back("status",
                        value + (*item.number == 1 ? " (every container found or made)"
                                                   : " (a container could not be found or made)"));
    } else if (const ItemName* name = nameOf(item.valueType)) {
      rows.emplace_back(name->text, value);
    } else if ((item.valueType == kKSTUpcallReplyGroupId ||
                item.valueType == kKSTUpcallReplySystemGroupId) &&
               i + 1 < reply.items.size() && reply.items[i + 1].text) {
      const bool system = item.valueType == kKSTUpcallReplySystemGroupId;
      rows.emplace_back(std::string(system ? "system group " : "group ") + value,
                        *reply.items[++i].text);
    } else {
      rows.emplace_back("item " + std::to_string(item.valueType), value);
    }
  }
  std::size_t width = 0;
  for (const auto& row : rows) width = std::max(width, row.first.size());
  std::string out;
  for (const auto& [what, value] : rows) {
    out += what;
    out.append(width - what.size() + 2, ' ');
    out += value;
    out += '\n';
  }
  return out;
}

nlohmann::json upcallReplyToJson(const DecodedUpcallReply& reply) {
  nlohmann::json json = nlohmann::json::object();
  json["ReturnCode"] = reply.returnCode;
  if (reply.returnCode != kKSTUpcallAnswered) return json;
  if (const auto status = statusOf(reply)) json["Status"] = *status;
  for (const UpcallReplyItem& item : reply.items) {
    if (const ItemName* name = nameOf(item.valueType); name && item.text) {
      json[name->key] = *item.text;
    }
  }
  const auto groups = [&](const char* key, std::uint16_t keyType, std::uint16_t valueType) {
    const auto pairs = pairsOf(reply, keyType, valueType);
    if (pairs.empty()) return;
    json[key] = nlohmann::json::object();
    for (const auto& [group, path] : pairs) json[key][group] = path;
  };
  groups("Groups", kKSTUpcallReplyGroupId, kKSTUpcallReplyGroupContainer);
  groups("SystemGroups", kKSTUpcallReplySystemGroupId, kKSTUpcallReplySystemGroupContainer);
  nlohmann::json items = nlohmann::json::array();
  for (const UpcallReplyItem& item : reply.items) {
    nlohmann::json entry = {{"ValueType", item.valueType}};
    if (item.text) entry["Value"] = *item.text;
    if (item.number) entry["Value"] = *item.number;
    items.push_back(std::move(entry));
  }
  json["Items"] = std::move(items);
  return json;
}

}  // namespace kestrel::kestrelctl
