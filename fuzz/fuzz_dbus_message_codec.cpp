// Request bodies as a peer may send them over D-Bus: structurally valid
// messages (sd-bus checks the wire format before the daemon sees a message)
// of arbitrary types, mostly a{sv} with keys of the requests and variants of
// every D-Bus type, nested arrays, structures, dictionaries and variant chains
// beyond the depth a request may have. What the reader keeps must travel back
// through the writer and read as the same dictionary.
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/linux/dbus_message_codec.h"
#include "platform/message_ipc.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;

struct MessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using UniqueMessage = std::unique_ptr<sd_bus_message, MessageUnref>;

// A client bus on one end of a socket pair that nothing answers: enough to
// make, seal and read messages without sending them.
sd_bus* bus() {
  static sd_bus* const instance = [] {
    int fds[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds) != 0) {
      fail("socketpair failed");
    }
    sd_bus* b = nullptr;
    if (sd_bus_new(&b) < 0 || sd_bus_set_fd(b, fds[0], fds[0]) < 0 || sd_bus_start(b) < 0) {
      fail("cannot start a bus on a socket pair");
    }
    return b;
  }();
  return instance;
}

UniqueMessage newMessage() {
  sd_bus_message* raw = nullptr;
  if (sd_bus_message_new_method_call(bus(), &raw, "com.zorvane.kestreld", "/com/zorvane/kestreld",
                                     "com.zorvane.kestreld", "Request") < 0) {
    fail("cannot make a message");
  }
  return UniqueMessage(raw);
}

// Seals the message and rewinds it for reading; false when sd-bus refused
// something appended to it.
bool seal(sd_bus_message* m) {
  static std::uint64_t cookie = 0;
  return sd_bus_message_seal(m, ++cookie, 0) >= 0 && sd_bus_message_rewind(m, 1) >= 0;
}

constexpr const char* kKeys[] = {"UserID",  "ContainerClass", "Identifier",
                                 "UUID",    "Transient",      "IdentifiersArray",
                                 "Command", "Value",          "CodeSigningInfo"};
constexpr char kBasicTypes[] = "ybnqiuxtdsog";

// One complete type: a basic type, a variant, an array, a structure or a dictionary.
std::string drawType(FuzzedDataProvider& in, int depth) {
  const int kind = in.ConsumeIntegralInRange(0, depth < 4 ? 5 : 1);
  switch (kind) {
    case 0:
      return std::string(1, kBasicTypes[in.ConsumeIntegralInRange<std::size_t>(0, 11)]);
    case 1:
      return "v";
    case 2:
    case 3:
      return "a" + drawType(in, depth + 1);
    case 4: {
      std::string fields = "(";
      const int count = in.ConsumeIntegralInRange(1, 3);
      for (int i = 0; i < count; ++i) fields += drawType(in, depth + 1);
      return fields + ")";
    }
    default:
      return std::string("a{") + kBasicTypes[in.ConsumeIntegralInRange<std::size_t>(0, 11)] +
             drawType(in, depth + 1) + "}";
  }
}

// The length of the complete type that starts the signature.
std::size_t completeTypeLength(const std::string& s, std::size_t at = 0) {
  if (s[at] == 'a') return 1 + completeTypeLength(s, at + 1);
  if (s[at] == '(' || s[at] == '{') {
    const char close = s[at] == '(' ? ')' : '}';
    std::size_t i = at + 1;
    while (s[i] != close) i += completeTypeLength(s, i);
    return i + 1 - at;
  }
  return 1;
}

std::string drawText(FuzzedDataProvider& in) {
  if (in.ConsumeBool()) return kKeys[in.ConsumeIntegralInRange<std::size_t>(0, 8)];
  std::string text = in.ConsumeRandomLengthString(24);
  for (char& c : text) {
    if (static_cast<unsigned char>(c) >= 0x80 || c == '\0') c = '?';
  }
  if (in.ConsumeBool()) text += "\xc3\xa9\xe2\x82\xac";  // some non-ASCII UTF-8
  return text;
}

void appendValue(FuzzedDataProvider& in, sd_bus_message* m, const std::string& type, int depth);

void appendBasic(FuzzedDataProvider& in, sd_bus_message* m, char type) {
  switch (type) {
    case 'y': {
      const auto v = in.ConsumeIntegral<std::uint8_t>();
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 'b': {
      const int v = in.ConsumeBool() ? 1 : 0;
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 'n':
    case 'q': {
      const auto v = in.ConsumeIntegral<std::uint16_t>();
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 'i':
    case 'u': {
      const auto v = in.ConsumeIntegral<std::uint32_t>();
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 'x':
    case 't': {
      const auto v = in.ConsumeIntegral<std::uint64_t>();
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 'd': {
      const double v = in.ConsumeFloatingPoint<double>();
      sd_bus_message_append_basic(m, type, &v);
      return;
    }
    case 's': {
      const std::string v = drawText(in);
      sd_bus_message_append_basic(m, type, v.c_str());
      return;
    }
    case 'o':
      sd_bus_message_append_basic(m, type, in.ConsumeBool() ? "/" : "/com/zorvane/kestreld");
      return;
    default:  // 'g'
      sd_bus_message_append_basic(m, type, in.ConsumeBool() ? "a{sv}" : "");
      return;
  }
}

void appendValue(FuzzedDataProvider& in, sd_bus_message* m, const std::string& type, int depth) {
  switch (type[0]) {
    case 'v': {
      // Now and then a chain of variants of arrays deeper than a request may be.
      if (depth == 0 && in.ConsumeIntegralInRange(0, 15) == 0) {
        const int levels = in.ConsumeIntegralInRange(28, 36);
        for (int i = 0; i < levels; ++i) {
          sd_bus_message_open_container(m, 'v', "av");
          sd_bus_message_open_container(m, 'a', "v");
        }
        sd_bus_message_append(m, "v", "s", "bottom");
        for (int i = 0; i < levels; ++i) {
          sd_bus_message_close_container(m);
          sd_bus_message_close_container(m);
        }
        return;
      }
      const std::string inner = drawType(in, depth);
      sd_bus_message_open_container(m, 'v', inner.c_str());
      appendValue(in, m, inner, depth + 1);
      sd_bus_message_close_container(m);
      return;
    }
    case 'a': {
      const std::string element = type.substr(1);
      const char kind = element[0] == '{' ? 'e' : 0;
      sd_bus_message_open_container(m, 'a', element.c_str());
      const int count = in.ConsumeIntegralInRange(0, 4);
      for (int i = 0; i < count && in.remaining_bytes() > 0; ++i) {
        if (kind == 'e') {
          const std::string contents = element.substr(1, element.size() - 2);
          sd_bus_message_open_container(m, 'e', contents.c_str());
          appendBasic(in, m, contents[0]);
          appendValue(in, m, contents.substr(1), depth + 1);
          sd_bus_message_close_container(m);
        } else {
          appendValue(in, m, element, depth + 1);
        }
      }
      sd_bus_message_close_container(m);
      return;
    }
    case '(': {
      const std::string contents = type.substr(1, type.size() - 2);
      sd_bus_message_open_container(m, 'r', contents.c_str());
      for (std::size_t at = 0; at < contents.size();) {
        const std::size_t length = completeTypeLength(contents, at);
        appendValue(in, m, contents.substr(at, length), depth + 1);
        at += length;
      }
      sd_bus_message_close_container(m);
      return;
    }
    default:
      appendBasic(in, m, type[0]);
      return;
  }
}

// Mostly an a{sv}; now and then a body of another type, which must be refused.
void appendBody(FuzzedDataProvider& in, sd_bus_message* m) {
  if (in.ConsumeIntegralInRange(0, 7) == 0) {
    const std::string type = drawType(in, 0);
    appendValue(in, m, type, 0);
    return;
  }
  sd_bus_message_open_container(m, 'a', "{sv}");
  const int count = in.ConsumeIntegralInRange(0, 8);
  for (int i = 0; i < count && in.remaining_bytes() > 0; ++i) {
    sd_bus_message_open_container(m, 'e', "sv");
    const std::string key = drawText(in);
    sd_bus_message_append_basic(m, 's', key.c_str());
    appendValue(in, m, "v", 0);
    sd_bus_message_close_container(m);
  }
  sd_bus_message_close_container(m);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzedDataProvider in(data, size);
  const UniqueMessage message = newMessage();
  appendBody(in, message.get());
  if (!seal(message.get())) return 0;  // sd-bus would not have sent it either

  platform::MessageDictionary dictionary;
  if (platform::dbus::readDictionary(message.get(), &dictionary) < 0) return 0;
  // Rendering costs as much as reading; one input in four is enough for it.
  if (sampled({data, size}, 4)) (void)dictionary.description();

  // What was read travels again unchanged.
  const UniqueMessage copy = newMessage();
  const int r = platform::dbus::appendDictionary(copy.get(), dictionary);
  KESTREL_FUZZ_CHECK(
      r >= 0, "a dictionary read from the wire cannot be written: " + dictionary.description());
  KESTREL_FUZZ_CHECK(seal(copy.get()), "the written copy does not seal");
  platform::MessageDictionary reread;
  KESTREL_FUZZ_CHECK(platform::dbus::readDictionary(copy.get(), &reread) >= 0,
                     "the written copy does not read");
  KESTREL_FUZZ_CHECK(messageEquivalent(platform::MessageValue::fromDictionary(dictionary),
                                       platform::MessageValue::fromDictionary(reread)),
                     dictionary.description() + " came back as " + reread.description());
  return 0;
}
