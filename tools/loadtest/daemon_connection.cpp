#include "daemon_connection.h"

#include <cstring>
#include <stdexcept>

#include "platform/linux/dbus_listener.h"
#include "platform/linux/dbus_message_codec.h"

namespace kestrel::bench {

namespace {

constexpr const char* kService = "com.zorvane.kestreld";

struct MessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using MessageRef = std::unique_ptr<sd_bus_message, MessageUnref>;

}  // namespace

DaemonConnection::DaemonConnection(const std::string& address)
    : path_(platform::messageServiceObjectPath(kService)) {
  sd_bus* raw = nullptr;
  int r = sd_bus_new(&raw);
  bus_.reset(raw);
  if (r >= 0) r = sd_bus_set_address(raw, address.c_str());
  if (r >= 0) r = sd_bus_start(raw);
  if (r < 0) throw std::runtime_error("cannot connect to " + address + ": " + std::strerror(-r));
}

void DaemonConnection::ping() {
  sd_bus_message* reply = nullptr;
  const int r = sd_bus_call_method(bus_.get(), kService, path_.c_str(), "org.freedesktop.DBus.Peer",
                                   "Ping", nullptr, &reply, "");
  MessageRef owner(reply);
  if (r < 0) throw std::runtime_error(std::string("Ping failed: ") + std::strerror(-r));
}

std::uint64_t DaemonConnection::request(const platform::MessageDictionary& request,
                                        platform::MessageDictionary* reply) {
  return call(platform::kMessageRequestMethod, request, reply);
}

std::uint64_t DaemonConnection::floor(const platform::MessageDictionary& request) {
  return call("Floor", request, nullptr);
}

std::uint64_t DaemonConnection::call(const char* method, const platform::MessageDictionary& request,
                                     platform::MessageDictionary* reply) {
  sd_bus_message* call = nullptr;
  int r =
      sd_bus_message_new_method_call(bus_.get(), &call, kService, path_.c_str(), kService, method);
  MessageRef callOwner(call);
  if (r >= 0) r = platform::dbus::appendDictionary(call, request);
  sd_bus_message* rawReply = nullptr;
  if (r >= 0) r = sd_bus_call(bus_.get(), call, 0, nullptr, &rawReply);
  MessageRef replyOwner(rawReply);
  platform::MessageDictionary answer;
  if (r >= 0) r = platform::dbus::readDictionary(rawReply, &answer);
  if (r < 0) {
    throw std::runtime_error("command " + std::to_string(request.uint64("Command")) +
                             " failed: " + std::strerror(-r));
  }
  const std::uint64_t code = answer.uint64("ReplyError");
  if (reply != nullptr) *reply = std::move(answer);
  return code;
}

}  // namespace kestrel::bench
