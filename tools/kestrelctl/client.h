// The client side of the daemon's D-Bus interface: a direct connection to its
// socket and one Request call.
#pragma once

#include <cstdint>
#include <string>

#include "platform/message_ipc.h"

namespace kestrel::kestrelctl {

struct CallOutcome {
  enum class Kind {
    Reply,        // the daemon answered; `reply` holds it
    Unreachable,  // no connection could be made
    Refused,      // the daemon closed the connection without a reply
    ErrorReply,   // a D-Bus error came back (bad call, limits, timeout...)
  };
  Kind kind = Kind::Unreachable;
  platform::MessageDictionary reply;
  std::string message;  // what went wrong, for the other kinds
};

// Sends "Command" plus the items and waits for the reply; timeoutSeconds 0
// waits for ever.
CallOutcome callDaemon(const std::string& address, const std::string& serviceName,
                       const platform::MessageDictionary& request, std::uint64_t timeoutSeconds);

}  // namespace kestrel::kestrelctl
