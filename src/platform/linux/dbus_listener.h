// Message IPC on Linux: D-Bus, peer to peer.
//
// A service listens on the Unix stream socket <root>/run/kestrel/<service>.
// Every accepted connection is a direct D-Bus connection that sd-bus drives in
// server mode (EXTERNAL authentication; no bus daemon). The service answers
// the method `Request` (a{sv} -> a{sv}) of the interface named after the
// service, on the object path made of the service name ("com.zorvane.kestreld"
// -> "/com/zorvane/kestreld"), and org.freedesktop.DBus.Hello, so that
// ordinary clients (busctl --address=unix:path=..., gdbus) can talk to it.
//
// One thread accepts connections and reads each peer's credentials right at
// accept; every connection is then served on a thread of its own, which reads
// its requests and runs the handler for each, in order, as an item of the
// listener's queue (see dbus_peer_session.h).
#pragma once

#include <memory>
#include <string>

#include "platform/message_ipc.h"
#include "platform/root.h"

namespace kestrel::platform {

std::shared_ptr<MessageIPC> makeLinuxMessageIPC(const FilesystemRoot& root);

// <root>/run/kestrel/<serviceName>
std::string messageServiceSocketPath(const FilesystemRoot& root, const std::string& serviceName);
// "com.zorvane.kestreld" -> "/com/zorvane/kestreld"
std::string messageServiceObjectPath(const std::string& serviceName);
// The method every request calls; its interface is the service name.
inline constexpr const char* kMessageRequestMethod = "Request";

}  // namespace kestrel::platform
