#include "platform/linux/dbus_message_codec.h"

#include <cerrno>
#include <cstring>
#include <string>

namespace kestrel::platform::dbus {

namespace {

// ---------------------------------------------------------------------------
// Writing

int appendValue(sd_bus_message* m, const MessageValue& value, std::size_t depth);

int appendDictionaryBody(sd_bus_message* m, const MessageDictionary& dictionary,
                         std::size_t depth) {
  if (depth > kMaxMessageDepth) return -ELOOP;
  int r = sd_bus_message_open_container(m, 'a', "{sv}");
  if (r < 0) return r;
  for (const auto& [key, value] : dictionary.entries()) {
    if (key.find('\0') != std::string::npos) return -EINVAL;
    r = sd_bus_message_open_container(m, 'e', "sv");
    if (r < 0) return r;
    r = sd_bus_message_append_basic(m, 's', key.c_str());
    if (r < 0) return r;
    r = appendValue(m, value, depth + 1);
    if (r < 0) return r;
    r = sd_bus_message_close_container(m);
    if (r < 0) return r;
  }
  return sd_bus_message_close_container(m);
}

int appendBasicVariant(sd_bus_message* m, char type, const void* value) {
  const char signature[2] = {type, '\0'};
  int r = sd_bus_message_open_container(m, 'v', signature);
  if (r < 0) return r;
  r = sd_bus_message_append_basic(m, type, value);
  if (r < 0) return r;
  return sd_bus_message_close_container(m);
}

int appendValue(sd_bus_message* m, const MessageValue& value, std::size_t depth) {
  switch (value.type()) {
    case MessageValue::Type::Uint64: {
      const std::uint64_t v = *value.uint64();
      return appendBasicVariant(m, 't', &v);
    }
    case MessageValue::Type::Int64: {
      const std::int64_t v = *value.int64();
      return appendBasicVariant(m, 'x', &v);
    }
    case MessageValue::Type::Boolean: {
      const int v = *value.boolean() ? 1 : 0;
      return appendBasicVariant(m, 'b', &v);
    }
    case MessageValue::Type::Double: {
      const double v = *value.real();
      return appendBasicVariant(m, 'd', &v);
    }
    case MessageValue::Type::String: {
      const std::string& v = *value.string();
      if (v.find('\0') != std::string::npos) return -EINVAL;
      return appendBasicVariant(m, 's', v.c_str());
    }
    case MessageValue::Type::Data: {
      int r = sd_bus_message_open_container(m, 'v', "ay");
      if (r < 0) return r;
      const MessageData& v = *value.data();
      r = sd_bus_message_append_array(m, 'y', v.data(), v.size());
      if (r < 0) return r;
      return sd_bus_message_close_container(m);
    }
    case MessageValue::Type::Array: {
      if (depth > kMaxMessageDepth) return -ELOOP;
      int r = sd_bus_message_open_container(m, 'v', "av");
      if (r < 0) return r;
      r = sd_bus_message_open_container(m, 'a', "v");
      if (r < 0) return r;
      for (const MessageValue& element : *value.array()) {
        r = appendValue(m, element, depth + 1);
        if (r < 0) return r;
      }
      r = sd_bus_message_close_container(m);
      if (r < 0) return r;
      return sd_bus_message_close_container(m);
    }
    case MessageValue::Type::Dictionary: {
      int r = sd_bus_message_open_container(m, 'v', "a{sv}");
      if (r < 0) return r;
      r = appendDictionaryBody(m, *value.dictionary(), depth);
      if (r < 0) return r;
      return sd_bus_message_close_container(m);
    }
  }
  return -EINVAL;
}

// ---------------------------------------------------------------------------
// Reading

enum class Outcome {
  Value,   // read and kept
  Absent,  // a type outside the model: reads as absent where it stands
  Reject,  // too deep or beyond the byte budget: the whole top-level entry goes
};

// Each value costs its content plus a fixed amount for its node, so that a
// flood of tiny values is bounded too.
constexpr std::size_t kValueOverhead = 16;

struct Reader {
  sd_bus_message* m;
  std::size_t bytes = 0;

  bool charge(std::size_t amount) {
    bytes += amount + kValueOverhead;
    return bytes <= kMaxMessageBytes;
  }
};

int readVariant(Reader& reader, std::size_t depth, MessageValue* out, Outcome* outcome);

// The entries of an a{sv} whose 'a' container is entered already.
int readEntries(Reader& reader, std::size_t depth, MessageDictionary* out, Outcome* outcome) {
  *outcome = Outcome::Value;
  for (;;) {
    int r = sd_bus_message_enter_container(reader.m, 'e', "sv");
    if (r < 0) return r;
    if (r == 0) return 0;
    if (*outcome == Outcome::Reject) {
      r = sd_bus_message_skip(reader.m, "sv");
      if (r < 0) return r;
    } else {
      const char* key = nullptr;
      r = sd_bus_message_read_basic(reader.m, 's', &key);
      if (r < 0) return r;
      std::string name(key);
      MessageValue value;
      Outcome valueOutcome = Outcome::Value;
      r = readVariant(reader, depth + 1, &value, &valueOutcome);
      if (r < 0) return r;
      if (valueOutcome == Outcome::Reject || !reader.charge(name.size())) {
        *outcome = Outcome::Reject;
        *out = MessageDictionary();
      } else if (valueOutcome == Outcome::Value) {
        out->set(std::move(name), std::move(value));
      }
    }
    r = sd_bus_message_exit_container(reader.m);
    if (r < 0) return r;
  }
}

int readContents(Reader& reader, const std::string& signature, std::size_t depth, MessageValue* out,
                 Outcome* outcome) {
  sd_bus_message* m = reader.m;
  *outcome = Outcome::Value;
  int r = 0;
  if (signature == "t") {
    std::uint64_t v = 0;
    r = sd_bus_message_read_basic(m, 't', &v);
    *out = MessageValue::fromUint64(v);
  } else if (signature == "x") {
    std::int64_t v = 0;
    r = sd_bus_message_read_basic(m, 'x', &v);
    *out = MessageValue::fromInt64(v);
  } else if (signature == "b") {
    int v = 0;
    r = sd_bus_message_read_basic(m, 'b', &v);
    *out = MessageValue::fromBoolean(v != 0);
  } else if (signature == "d") {
    double v = 0;
    r = sd_bus_message_read_basic(m, 'd', &v);
    *out = MessageValue::fromReal(v);
  } else if (signature == "s") {
    const char* v = nullptr;
    r = sd_bus_message_read_basic(m, 's', &v);
    if (r >= 0) {
      const std::size_t length = std::strlen(v);
      if (!reader.charge(length)) {
        *outcome = Outcome::Reject;
      } else {
        *out = MessageValue::fromString(std::string(v, length));
      }
    }
    return r;
  } else if (signature == "ay") {
    const void* data = nullptr;
    std::size_t size = 0;
    r = sd_bus_message_read_array(m, 'y', &data, &size);
    if (r >= 0) {
      if (!reader.charge(size)) {
        *outcome = Outcome::Reject;
      } else {
        const auto* bytes = static_cast<const std::uint8_t*>(data);
        *out = MessageValue::fromData(size > 0 ? MessageData(bytes, bytes + size) : MessageData());
      }
    }
    return r;
  } else if (signature == "av") {
    if (depth > kMaxMessageDepth) {
      *outcome = Outcome::Reject;
      return sd_bus_message_skip(m, "av");
    }
    r = sd_bus_message_enter_container(m, 'a', "v");
    if (r < 0) return r;
    MessageArray elements;
    for (;;) {
      r = sd_bus_message_at_end(m, 0);
      if (r < 0) return r;
      if (r > 0) break;
      if (*outcome == Outcome::Reject) {
        r = sd_bus_message_skip(m, "v");
        if (r < 0) return r;
        continue;
      }
      MessageValue element;
      Outcome elementOutcome = Outcome::Value;
      r = readVariant(reader, depth + 1, &element, &elementOutcome);
      if (r < 0) return r;
      if (elementOutcome == Outcome::Reject) {
        *outcome = Outcome::Reject;
        elements.clear();
      } else if (elementOutcome == Outcome::Absent) {
        *outcome = Outcome::Absent;
      } else if (*outcome == Outcome::Value) {
        elements.push_back(std::move(element));
      }
    }
    r = sd_bus_message_exit_container(m);
    if (r < 0) return r;
    if (*outcome == Outcome::Value) {
      if (!reader.charge(0)) {
        *outcome = Outcome::Reject;
      } else {
        *out = MessageValue::fromArray(std::move(elements));
      }
    }
    return 0;
  } else if (signature == "a{sv}") {
    if (depth > kMaxMessageDepth) {
      *outcome = Outcome::Reject;
      return sd_bus_message_skip(m, "a{sv}");
    }
    r = sd_bus_message_enter_container(m, 'a', "{sv}");
    if (r < 0) return r;
    MessageDictionary dictionary;
    r = readEntries(reader, depth, &dictionary, outcome);
    if (r < 0) return r;
    r = sd_bus_message_exit_container(m);
    if (r < 0) return r;
    if (*outcome == Outcome::Value) {
      if (!reader.charge(0)) {
        *outcome = Outcome::Reject;
      } else {
        *out = MessageValue::fromDictionary(std::move(dictionary));
      }
    }
    return 0;
  } else {
    // Any other type (small integers, object paths, structures, descriptors...)
    // is not part of the model.
    *outcome = Outcome::Absent;
    return sd_bus_message_skip(m, signature.c_str());
  }
  if (r >= 0 && !reader.charge(0)) *outcome = Outcome::Reject;
  return r;
}

int readVariant(Reader& reader, std::size_t depth, MessageValue* out, Outcome* outcome) {
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(reader.m, &type, &contents);
  if (r < 0) return r;
  if (r == 0 || type != 'v' || contents == nullptr) return -EBADMSG;
  const std::string signature(contents);
  r = sd_bus_message_enter_container(reader.m, 'v', signature.c_str());
  if (r < 0) return r;
  r = readContents(reader, signature, depth, out, outcome);
  if (r < 0) return r;
  return sd_bus_message_exit_container(reader.m);
}

}  // namespace

int appendDictionary(sd_bus_message* message, const MessageDictionary& dictionary) {
  return appendDictionaryBody(message, dictionary, 1);
}

int readDictionary(sd_bus_message* message, MessageDictionary* dictionary) {
  Reader reader{message};
  int r = sd_bus_message_enter_container(message, 'a', "{sv}");
  if (r < 0) return r;
  if (r == 0) return -EBADMSG;
  MessageDictionary out;
  for (;;) {
    r = sd_bus_message_enter_container(message, 'e', "sv");
    if (r < 0) return r;
    if (r == 0) break;
    const char* key = nullptr;
    r = sd_bus_message_read_basic(message, 's', &key);
    if (r < 0) return r;
    std::string name(key);
    // What a rejected entry read does not count against those after it.
    const std::size_t before = reader.bytes;
    MessageValue value;
    Outcome outcome = Outcome::Value;
    r = readVariant(reader, 2, &value, &outcome);
    if (r < 0) return r;
    if (outcome == Outcome::Value && reader.charge(name.size())) {
      out.set(std::move(name), std::move(value));
    } else {
      reader.bytes = before;
    }
    r = sd_bus_message_exit_container(message);
    if (r < 0) return r;
  }
  r = sd_bus_message_exit_container(message);
  if (r < 0) return r;
  *dictionary = std::move(out);
  return 0;
}

}  // namespace kestrel::platform::dbus
