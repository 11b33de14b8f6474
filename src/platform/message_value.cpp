// Message values and dictionaries, their conversion to and from property
// lists, and the parts of a received message that every implementation shares.
#include <utility>

#include "platform/message_ipc.h"

namespace kestrel::platform {

// ---------------------------------------------------------------------------
// MessageValue

MessageValue MessageValue::fromUuid(const Uuid& v) {
  return fromData(MessageData(v.bytes().begin(), v.bytes().end()));
}

std::optional<std::uint64_t> MessageValue::uint64() const {
  if (const auto* v = std::get_if<std::uint64_t>(&value_)) return *v;
  return std::nullopt;
}

std::optional<std::int64_t> MessageValue::int64() const {
  if (const auto* v = std::get_if<std::int64_t>(&value_)) return *v;
  return std::nullopt;
}

std::optional<bool> MessageValue::boolean() const {
  if (const auto* v = std::get_if<bool>(&value_)) return *v;
  return std::nullopt;
}

std::optional<Uuid> MessageValue::uuid() const {
  if (const auto* v = data()) return Uuid::fromBytes(*v);
  return std::nullopt;
}

std::optional<double> MessageValue::real() const {
  if (const auto* v = std::get_if<double>(&value_)) return *v;
  return std::nullopt;
}

std::string MessageValue::description() const {
  if (auto plist = messageValueToPlist(*this)) return plist->description();
  return "(too deep)";
}

// ---------------------------------------------------------------------------
// Property-list conversion

namespace {

std::optional<PlistValue> toPlist(const MessageValue& value, std::size_t depth);

std::optional<PlistDictionary> dictionaryToPlist(const MessageDictionary& dictionary,
                                                 std::size_t depth) {
  if (depth > kMaxMessageDepth) return std::nullopt;
  PlistDictionary out;
  for (const auto& [key, value] : dictionary.entries()) {
    auto converted = toPlist(value, depth + 1);
    if (!converted) return std::nullopt;
    out.emplace(key, std::move(*converted));
  }
  return out;
}

std::optional<PlistValue> toPlist(const MessageValue& value, std::size_t depth) {
  switch (value.type()) {
    case MessageValue::Type::Uint64:
      return PlistValue(*value.uint64());
    case MessageValue::Type::Int64:
      return PlistValue(*value.int64());
    case MessageValue::Type::Boolean:
      return PlistValue(*value.boolean());
    case MessageValue::Type::String:
      return PlistValue(*value.string());
    case MessageValue::Type::Data:
      return PlistValue(PlistData(*value.data()));
    case MessageValue::Type::Double:
      return PlistValue(*value.real());
    case MessageValue::Type::Array: {
      if (depth > kMaxMessageDepth) return std::nullopt;
      PlistArray out;
      out.reserve(value.array()->size());
      for (const MessageValue& element : *value.array()) {
        auto converted = toPlist(element, depth + 1);
        if (!converted) return std::nullopt;
        out.push_back(std::move(*converted));
      }
      return PlistValue(std::move(out));
    }
    case MessageValue::Type::Dictionary: {
      auto out = dictionaryToPlist(*value.dictionary(), depth);
      if (!out) return std::nullopt;
      return PlistValue(std::move(*out));
    }
  }
  return std::nullopt;
}

std::optional<MessageValue> fromPlist(const PlistValue& value, std::size_t depth);

std::optional<MessageDictionary> dictionaryFromPlist(const PlistDictionary& dictionary,
                                                     std::size_t depth) {
  if (depth > kMaxMessageDepth) return std::nullopt;
  MessageDictionary out;
  for (const auto& [key, value] : dictionary) {
    auto converted = fromPlist(value, depth + 1);
    if (!converted) return std::nullopt;
    out.set(key, std::move(*converted));
  }
  return out;
}

std::optional<MessageValue> fromPlist(const PlistValue& value, std::size_t depth) {
  switch (value.type()) {
    case PlistValue::Type::Dictionary: {
      auto out = dictionaryFromPlist(*value.dictionary(), depth);
      if (!out) return std::nullopt;
      return MessageValue::fromDictionary(std::move(*out));
    }
    case PlistValue::Type::Array: {
      if (depth > kMaxMessageDepth) return std::nullopt;
      MessageArray out;
      out.reserve(value.array()->size());
      for (const PlistValue& element : *value.array()) {
        auto converted = fromPlist(element, depth + 1);
        if (!converted) return std::nullopt;
        out.push_back(std::move(*converted));
      }
      return MessageValue::fromArray(std::move(out));
    }
    case PlistValue::Type::String:
      return MessageValue::fromString(*value.string());
    case PlistValue::Type::Integer:
      return MessageValue::fromInt64(*value.signedInteger());
    case PlistValue::Type::UnsignedInteger:
      return MessageValue::fromUint64(*value.unsignedInteger());
    case PlistValue::Type::Real:
      return MessageValue::fromReal(*value.real());
    case PlistValue::Type::Boolean:
      return MessageValue::fromBoolean(*value.boolean());
    case PlistValue::Type::Data:
      return MessageValue::fromData(*value.data());
    case PlistValue::Type::Date:
      return MessageValue::fromReal(value.date()->secondsSinceReferenceDate);
  }
  return std::nullopt;
}

}  // namespace

std::optional<PlistValue> messageValueToPlist(const MessageValue& value) {
  return toPlist(value, 1);
}

std::optional<MessageValue> plistToMessageValue(const PlistValue& value) {
  return fromPlist(value, 1);
}

// ---------------------------------------------------------------------------
// MessageDictionary

const MessageValue* MessageDictionary::value(std::string_view key) const {
  auto it = entries_.find(key);
  return it == entries_.end() ? nullptr : &it->second;
}

bool MessageDictionary::contains(std::string_view key) const {
  return value(key) != nullptr;
}

std::uint64_t MessageDictionary::uint64(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->uint64().value_or(0) : 0;
}

std::int64_t MessageDictionary::int64(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->int64().value_or(0) : 0;
}

bool MessageDictionary::boolean(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr && v->boolean().value_or(false);
}

std::optional<std::string> MessageDictionary::string(std::string_view key) const {
  const MessageValue* v = value(key);
  if (v == nullptr || v->string() == nullptr) return std::nullopt;
  return *v->string();
}

std::optional<Uuid> MessageDictionary::uuid(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->uuid() : std::nullopt;
}

std::optional<MessageData> MessageDictionary::data(std::string_view key) const {
  const MessageValue* v = value(key);
  if (v == nullptr || v->data() == nullptr) return std::nullopt;
  return *v->data();
}

std::optional<double> MessageDictionary::real(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->real() : std::nullopt;
}

const MessageArray* MessageDictionary::array(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->array() : nullptr;
}

const MessageDictionary* MessageDictionary::dictionary(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? v->dictionary() : nullptr;
}

std::optional<PlistValue> MessageDictionary::plist(std::string_view key) const {
  const MessageValue* v = value(key);
  return v != nullptr ? messageValueToPlist(*v) : std::nullopt;
}

void MessageDictionary::set(std::string key, MessageValue value) {
  entries_.insert_or_assign(std::move(key), std::move(value));
}

void MessageDictionary::setUint64(std::string key, std::uint64_t value) {
  set(std::move(key), MessageValue::fromUint64(value));
}

void MessageDictionary::setInt64(std::string key, std::int64_t value) {
  set(std::move(key), MessageValue::fromInt64(value));
}

void MessageDictionary::setBoolean(std::string key, bool value) {
  set(std::move(key), MessageValue::fromBoolean(value));
}

void MessageDictionary::setString(std::string key, std::string value) {
  set(std::move(key), MessageValue::fromString(std::move(value)));
}

void MessageDictionary::setUuid(std::string key, const Uuid& value) {
  set(std::move(key), MessageValue::fromUuid(value));
}

void MessageDictionary::setData(std::string key, MessageData value) {
  set(std::move(key), MessageValue::fromData(std::move(value)));
}

void MessageDictionary::setReal(std::string key, double value) {
  set(std::move(key), MessageValue::fromReal(value));
}

void MessageDictionary::setArray(std::string key, MessageArray value) {
  set(std::move(key), MessageValue::fromArray(std::move(value)));
}

void MessageDictionary::setDictionary(std::string key, MessageDictionary value) {
  set(std::move(key), MessageValue::fromDictionary(std::move(value)));
}

bool MessageDictionary::setPlist(std::string key, const PlistValue& value) {
  auto converted = plistToMessageValue(value);
  if (!converted) return false;
  set(std::move(key), std::move(*converted));
  return true;
}

void MessageDictionary::remove(std::string_view key) {
  auto it = entries_.find(key);
  if (it != entries_.end()) entries_.erase(it);
}

std::size_t MessageDictionary::size() const {
  return entries_.size();
}

bool MessageDictionary::empty() const {
  return entries_.empty();
}

std::optional<PlistDictionary> MessageDictionary::toPlist() const {
  return dictionaryToPlist(*this, 1);
}

std::optional<MessageDictionary> MessageDictionary::fromPlist(const PlistDictionary& dictionary) {
  return dictionaryFromPlist(dictionary, 1);
}

std::string MessageDictionary::description() const {
  if (auto plist = toPlist()) return PlistValue(std::move(*plist)).description();
  return "(too deep)";
}

bool operator==(const MessageDictionary& a, const MessageDictionary& b) {
  return a.entries_ == b.entries_;
}

// ---------------------------------------------------------------------------
// ReceivedMessage

ReceivedMessage::ReceivedMessage(MessageDictionary dictionary,
                                 std::shared_ptr<MessageReplyContext> replyContext,
                                 std::shared_ptr<MessageConnection> remoteConnection)
    : dictionary_(std::move(dictionary)),
      replyContext_(std::move(replyContext)),
      remoteConnection_(std::move(remoteConnection)) {}

std::optional<MessageDictionary> ReceivedMessage::makeReply() const {
  if (!hasReplyContext()) return std::nullopt;
  return MessageDictionary();
}

}  // namespace kestrel::platform
