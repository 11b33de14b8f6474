// One accepted D-Bus connection, served on a thread of its own.
//
// The connection's thread owns its sd-bus object: it reads each request and
// runs the handler right there, as an item of the listener's queue, so a
// request and its reply need no hand-over between threads and the requests of
// one connection are handled one after the other, in order. A reply made
// later on another thread (a deferred reply), or a cancel from elsewhere,
// reaches the connection's thread through its inbox.
#pragma once

#include <systemd/sd-id128.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/message_ipc.h"
#include "platform/unique_fd.h"

namespace kestrel::platform::dbus {

// What every connection of one listener shares. Immutable once made.
struct ServiceEndpoint {
  std::string serviceName;
  std::string objectPath;  // of the service name
  sd_id128_t serverId = {};
  std::shared_ptr<DispatchQueue> queue;  // the listener's queue
  MessageHandler handler;
};

// What other threads ask of a connection's thread.
struct PeerCommand {
  enum class Kind { Reply, Forget, Cancel };
  Kind kind = Kind::Cancel;
  std::uint64_t requestId = 0;
  MessageDictionary reply;
};

// Commands for one connection's thread, from any thread; an eventfd wakes it.
class PeerInbox {
 public:
  // nullptr when no eventfd could be made.
  static std::shared_ptr<PeerInbox> create();
  explicit PeerInbox(UniqueFd wakeFd) : wakeFd_(std::move(wakeFd)) {}

  int fd() const { return wakeFd_.get(); }
  // Dropped once the connection is closed.
  void post(PeerCommand command);
  // Everything posted so far; clears the wake-up.
  std::vector<PeerCommand> take();
  // Later posts are dropped.
  void close();

 private:
  UniqueFd wakeFd_;
  std::mutex mutex_;
  std::vector<PeerCommand> commands_;
  bool closed_ = false;
};

// Serves the connection on the calling thread until the peer leaves, the
// connection fails or is cancelled (by a handler, or by posting Cancel to the
// inbox). `id` names the connection in its bus name (":1.<id>").
void servePeer(const ServiceEndpoint& endpoint, std::uint64_t id, UniqueFd fd,
               PeerCredentials credentials, std::shared_ptr<PeerInbox> inbox);

}  // namespace kestrel::platform::dbus
