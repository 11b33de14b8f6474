// One peer-to-peer D-Bus connection to a running kestreld, kept open across
// calls, for the request benchmark and the load test. Failures of the
// transport throw std::runtime_error; the daemon's own answers are codes.
#pragma once

#include <systemd/sd-bus.h>

#include <cstdint>
#include <memory>
#include <string>

#include "platform/message_ipc.h"

namespace kestrel::bench {

class DaemonConnection {
 public:
  explicit DaemonConnection(const std::string& address);

  // org.freedesktop.DBus.Peer.Ping: the transport's floor.
  void ping();
  // Sends the request and returns the reply's "ReplyError"; the reply itself
  // goes to *reply when given.
  std::uint64_t request(const platform::MessageDictionary& request,
                        platform::MessageDictionary* reply = nullptr);
  // The same request to the "Floor" method of a daemon built with the
  // benchmarks: decoded and answered with a reply of the same shape, no work.
  std::uint64_t floor(const platform::MessageDictionary& request);

 private:
  std::uint64_t call(const char* method, const platform::MessageDictionary& request,
                     platform::MessageDictionary* reply);

  struct BusUnref {
    void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
  };
  std::unique_ptr<sd_bus, BusUnref> bus_;
  std::string path_;
};

}  // namespace kestrel::bench
