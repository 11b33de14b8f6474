#include "request_items.h"

#include <cerrno>
#include <charconv>
#include <nlohmann/json.hpp>

#include "platform/hex.h"
#include "platform/uuid.h"

namespace kestrel::kestrelctl {

namespace {

template <typename T>
bool parseInteger(std::string_view text, T* out) {
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty()) return false;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), *out, base);
  return ec == std::errc() && end == text.data() + text.size();
}

std::optional<bool> parseBool(std::string_view text) {
  if (text == "true" || text == "1" || text == "yes") return true;
  if (text == "false" || text == "0" || text == "no") return false;
  return std::nullopt;
}

std::optional<platform::MessageData> parseHex(std::string_view text) {
  if (text.size() % 2 != 0) return std::nullopt;
  platform::MessageData out(text.size() / 2);
  if (!platform::decodeHex(text, out)) return std::nullopt;
  return out;
}

// Far deeper than any request can travel, and shallow enough that the
// conversion (one call a level) cannot run out of stack.
constexpr std::size_t kMaxJsonDepth = 256;

std::optional<PlistValue> fromJson(const nlohmann::json& json, std::size_t depth,
                                   std::string* error) {
  if (depth > kMaxJsonDepth && (json.is_object() || json.is_array())) {
    *error = "nested deeper than " + std::to_string(kMaxJsonDepth) + " levels";
    return std::nullopt;
  }
  switch (json.type()) {
    case nlohmann::json::value_t::object: {
      PlistDictionary out;
      for (const auto& [key, value] : json.items()) {
        auto converted = fromJson(value, depth + 1, error);
        if (!converted) return std::nullopt;
        out.emplace(key, std::move(*converted));
      }
      return PlistValue(std::move(out));
    }
    case nlohmann::json::value_t::array: {
      PlistArray out;
      for (const auto& value : json) {
        auto converted = fromJson(value, depth + 1, error);
        if (!converted) return std::nullopt;
        out.push_back(std::move(*converted));
      }
      return PlistValue(std::move(out));
    }
    case nlohmann::json::value_t::string:
      return PlistValue(json.get<std::string>());
    case nlohmann::json::value_t::boolean:
      return PlistValue(json.get<bool>());
    case nlohmann::json::value_t::number_integer:
      return PlistValue(json.get<std::int64_t>());
    case nlohmann::json::value_t::number_unsigned: {
      const auto value = json.get<std::uint64_t>();
      if (value <= static_cast<std::uint64_t>(INT64_MAX)) {
        return PlistValue(static_cast<std::int64_t>(value));
      }
      return PlistValue(value);
    }
    case nlohmann::json::value_t::number_float:
      return PlistValue(json.get<double>());
    default:
      *error = "null has no property-list form";
      return std::nullopt;
  }
}

}  // namespace

std::optional<PlistValue> plistFromJson(std::string_view json, std::string* error) {
  const auto parsed = nlohmann::json::parse(json, nullptr, /*allow_exceptions=*/false);
  if (parsed.is_discarded()) {
    *error = "not valid JSON";
    return std::nullopt;
  }
  return fromJson(parsed, 1, error);
}

bool addRequestItem(std::string_view item, platform::MessageDictionary* request,
                    std::string* error) {
  const std::size_t equals = item.find('=');
  const std::size_t colon = equals == std::string_view::npos ? equals : item.find(':', equals + 1);
  if (equals == 0 || equals == std::string_view::npos || colon == std::string_view::npos) {
    *error = "expected key=type:value, got \"" + std::string(item) + "\"";
    return false;
  }
  std::string key(item.substr(0, equals));
  const std::string_view type = item.substr(equals + 1, colon - equals - 1);
  const std::string_view value = item.substr(colon + 1);
  auto bad = [&](const std::string& what) {
    *error = "\"" + key + "\": " + what;
    return false;
  };

  if (type == "u64") {
    std::uint64_t v = 0;
    if (!parseInteger(value, &v))
      return bad("not an unsigned 64-bit integer: " + std::string(value));
    request->setUint64(std::move(key), v);
  } else if (type == "i64") {
    std::int64_t v = 0;
    std::string_view digits = value;
    const bool negative = !digits.empty() && digits[0] == '-';
    if (negative) digits.remove_prefix(1);
    std::uint64_t magnitude = 0;
    if (!parseInteger(digits, &magnitude) ||
        magnitude > (negative ? static_cast<std::uint64_t>(INT64_MAX) + 1
                              : static_cast<std::uint64_t>(INT64_MAX))) {
      return bad("not a signed 64-bit integer: " + std::string(value));
    }
    v = negative ? static_cast<std::int64_t>(0 - magnitude) : static_cast<std::int64_t>(magnitude);
    request->setInt64(std::move(key), v);
  } else if (type == "bool") {
    const auto v = parseBool(value);
    if (!v) return bad("not a boolean (true/false, 1/0, yes/no): " + std::string(value));
    request->setBoolean(std::move(key), *v);
  } else if (type == "str") {
    request->setString(std::move(key), std::string(value));
  } else if (type == "uuid") {
    const auto v = platform::Uuid::parse(value);
    if (!v) return bad("not a UUID: " + std::string(value));
    request->setUuid(std::move(key), *v);
  } else if (type == "data") {
    auto v = parseHex(value);
    if (!v) return bad("not hexadecimal bytes: " + std::string(value));
    request->setData(std::move(key), std::move(*v));
  } else if (type == "plist") {
    std::string why;
    auto v = plistFromJson(value, &why);
    if (!v) return bad(why);
    if (!request->setPlist(key, *v)) return bad("nested too deep");
  } else {
    return bad("unknown type \"" + std::string(type) +
               "\" (u64, i64, bool, str, uuid, data, plist)");
  }
  return true;
}

}  // namespace kestrel::kestrelctl
