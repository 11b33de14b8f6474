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
// One thread owns every sd-bus object: it accepts, reads each peer's
// credentials right at accept, decodes requests and sends replies. Requests of
// one connection go in order to a serial queue of its own, targeted at the
// listener's queue; replies made on any thread are handed back to the IPC
// thread through an eventfd.
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
