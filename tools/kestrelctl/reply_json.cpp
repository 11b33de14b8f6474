#include "reply_json.h"

#include <string>

#include "platform/uuid.h"

namespace kestrel::kestrelctl {

namespace {

std::string hex(const platform::MessageData& data) {
  static const char* digits = "0123456789abcdef";
  std::string out;
  out.reserve(data.size() * 2);
  for (std::uint8_t byte : data) {
    out += digits[byte >> 4];
    out += digits[byte & 15];
  }
  return out;
}

nlohmann::json toJson(const platform::MessageValue& value, bool uuidKey);

nlohmann::json dictionaryToJson(const platform::MessageDictionary& dictionary) {
  nlohmann::json out = nlohmann::json::object();
  for (const auto& [key, value] : dictionary.entries()) {
    out[key] = toJson(value, key.find("UUID") != std::string::npos);
  }
  return out;
}

nlohmann::json toJson(const platform::MessageValue& value, bool uuidKey) {
  using Type = platform::MessageValue::Type;
  switch (value.type()) {
    case Type::Uint64:
      return *value.uint64();
    case Type::Int64:
      return *value.int64();
    case Type::Boolean:
      return *value.boolean();
    case Type::String:
      return *value.string();
    case Type::Double:
      return *value.real();
    case Type::Data:
      if (uuidKey) {
        if (auto uuid = value.uuid()) return uuid->string();
      }
      return hex(*value.data());
    case Type::Array: {
      nlohmann::json out = nlohmann::json::array();
      for (const auto& element : *value.array()) out.push_back(toJson(element, uuidKey));
      return out;
    }
    case Type::Dictionary:
      return dictionaryToJson(*value.dictionary());
  }
  return nullptr;
}

}  // namespace

nlohmann::json replyToJson(const platform::MessageDictionary& reply) {
  return dictionaryToJson(reply);
}

}  // namespace kestrel::kestrelctl
