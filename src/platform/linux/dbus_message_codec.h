// Message dictionaries on the D-Bus wire: a dictionary is an a{sv}; values are
// uint64 "t", int64 "x", boolean "b", string "s", data (and UUIDs) "ay",
// array "av", dictionary "a{sv}" and double "d". Shared by the listener and by
// the command-line client.
#pragma once

#include <systemd/sd-bus.h>

#include "platform/message_ipc.h"

namespace kestrel::platform::dbus {

// Appends the dictionary as an a{sv} at the message's write position.
// A negative errno when it cannot travel (a string that is not valid UTF-8 or
// holds a NUL, containers nested deeper than kMaxMessageDepth).
int appendDictionary(sd_bus_message* message, const MessageDictionary& dictionary);

// Reads an a{sv} at the message's read position into `dictionary`.
//  - An entry whose value has a type outside the model is left out, and so is
//    an entry of a nested dictionary; an array with such an element is left
//    out as a whole (its indexes would otherwise shift).
//  - A top-level entry that holds containers nested deeper than
//    kMaxMessageDepth, or that would take the content read so far beyond
//    kMaxMessageBytes, is left out as a whole.
// A negative errno when the message does not hold an a{sv} there.
int readDictionary(sd_bus_message* message, MessageDictionary* dictionary);

}  // namespace kestrel::platform::dbus
