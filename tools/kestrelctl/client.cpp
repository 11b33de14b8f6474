#include "client.h"

#include <systemd/sd-bus.h>

#include <cerrno>
#include <cstring>
#include <memory>

#include "platform/linux/dbus_listener.h"
#include "platform/linux/dbus_message_codec.h"

namespace kestrel::kestrelctl {

namespace {

struct BusUnref {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct MessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
struct ErrorFree {
  void operator()(sd_bus_error* e) const { sd_bus_error_free(e); }
};

CallOutcome failure(CallOutcome::Kind kind, std::string message) {
  CallOutcome outcome;
  outcome.kind = kind;
  outcome.message = std::move(message);
  return outcome;
}

}  // namespace

CallOutcome callDaemon(const std::string& address, const std::string& serviceName,
                       const platform::MessageDictionary& request, std::uint64_t timeoutSeconds) {
  sd_bus* rawBus = nullptr;
  int r = sd_bus_new(&rawBus);
  std::unique_ptr<sd_bus, BusUnref> bus(rawBus);
  if (r >= 0) r = sd_bus_set_address(rawBus, address.c_str());
  if (r >= 0) r = sd_bus_start(rawBus);
  if (r < 0) {
    return failure(CallOutcome::Kind::Unreachable,
                   "cannot reach the daemon at " + address + ": " + std::strerror(-r));
  }

  const std::string objectPath = platform::messageServiceObjectPath(serviceName);
  sd_bus_message* rawCall = nullptr;
  r = sd_bus_message_new_method_call(rawBus, &rawCall, serviceName.c_str(), objectPath.c_str(),
                                     serviceName.c_str(), platform::kMessageRequestMethod);
  std::unique_ptr<sd_bus_message, MessageUnref> call(rawCall);
  if (r >= 0) r = platform::dbus::appendDictionary(rawCall, request);
  if (r < 0) {
    return failure(CallOutcome::Kind::ErrorReply,
                   std::string("cannot build the request: ") + std::strerror(-r));
  }

  sd_bus_error error = SD_BUS_ERROR_NULL;
  std::unique_ptr<sd_bus_error, ErrorFree> errorOwner(&error);
  sd_bus_message* rawReply = nullptr;
  const std::uint64_t timeout = timeoutSeconds == 0 ? UINT64_MAX : timeoutSeconds * 1000000;
  r = sd_bus_call(rawBus, rawCall, timeout, &error, &rawReply);
  std::unique_ptr<sd_bus_message, MessageUnref> reply(rawReply);
  if (r < 0) {
    if (r == -ECONNRESET || r == -ENOTCONN || r == -EPIPE) {
      return failure(CallOutcome::Kind::Refused,
                     "the daemon closed the connection without a reply (request refused)");
    }
    if (sd_bus_error_is_set(&error)) {
      return failure(CallOutcome::Kind::ErrorReply,
                     std::string(error.name) + ": " + (error.message ? error.message : ""));
    }
    return failure(CallOutcome::Kind::ErrorReply,
                   std::string("the call failed: ") + std::strerror(-r));
  }

  CallOutcome outcome;
  outcome.kind = CallOutcome::Kind::Reply;
  r = platform::dbus::readDictionary(rawReply, &outcome.reply);
  if (r < 0) {
    return failure(CallOutcome::Kind::ErrorReply,
                   std::string("the reply is not a dictionary: ") + std::strerror(-r));
  }
  return outcome;
}

}  // namespace kestrel::kestrelctl
