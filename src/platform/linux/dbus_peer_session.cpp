#include "platform/linux/dbus_peer_session.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <systemd/sd-bus.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <map>
#include <utility>

#include "platform/linux/dbus_listener.h"
#include "platform/linux/dbus_message_codec.h"

namespace kestrel::platform::dbus {

namespace {

// Requests of one connection awaiting a reply made later on another thread; a
// request beyond this is answered at once with LimitsExceeded.
constexpr std::size_t kMaxRequestsInFlight = 1024;
// Replies a peer has not read yet; a peer that lets more pile up is closed.
constexpr std::uint64_t kMaxUnreadReplies = 1024;

struct BusMessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using BusMessagePtr = std::unique_ptr<sd_bus_message, BusMessageUnref>;

struct BusCloseUnref {
  void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
};
using BusPtr = std::unique_ptr<sd_bus, BusCloseUnref>;

std::uint64_t monotonicUsec() {
  struct timespec ts = {};
  ::clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<std::uint64_t>(ts.tv_sec) * 1000000u +
         static_cast<std::uint64_t>(ts.tv_nsec) / 1000u;
}

class PeerSession;

// The session the calling thread serves, if any: commands for it are carried
// out at once instead of going through the inbox.
thread_local PeerSession* tCurrentSession = nullptr;

void deliver(const std::shared_ptr<PeerInbox>& inbox, PeerCommand command);

// Names one request awaiting its reply. When the last copy of the received
// message goes without a reply, the request is forgotten.
class DBusReplyContext final : public MessageReplyContext {
 public:
  DBusReplyContext(std::shared_ptr<PeerInbox> inbox, std::uint64_t requestId)
      : inbox_(std::move(inbox)), requestId_(requestId) {}
  ~DBusReplyContext() override {
    if (!answered_.load()) deliver(inbox_, PeerCommand{PeerCommand::Kind::Forget, requestId_, {}});
  }

  const PeerInbox* inbox() const { return inbox_.get(); }
  std::uint64_t requestId() const { return requestId_; }
  // True for the one caller that may answer.
  bool claim() { return !answered_.exchange(true); }

 private:
  std::shared_ptr<PeerInbox> inbox_;
  std::uint64_t requestId_;
  std::atomic<bool> answered_{false};
};

class DBusConnection final : public MessageConnection {
 public:
  DBusConnection(PeerCredentials peer, std::shared_ptr<PeerInbox> inbox)
      : peer_(std::move(peer)), inbox_(std::move(inbox)) {}

  const PeerCredentials& peerCredentials() const override { return peer_; }

  void cancel() override {
    if (cancelled_.exchange(true)) return;
    deliver(inbox_, PeerCommand{PeerCommand::Kind::Cancel, 0, {}});
  }

  bool sendReply(const ReceivedMessage& request, MessageDictionary reply) override {
    auto* context = dynamic_cast<DBusReplyContext*>(request.replyContext().get());
    if (context == nullptr || context->inbox() != inbox_.get()) return false;
    if (cancelled_.load() || !context->claim()) return false;
    deliver(inbox_, PeerCommand{PeerCommand::Kind::Reply, context->requestId(), std::move(reply)});
    return true;
  }

 private:
  PeerCredentials peer_;
  std::shared_ptr<PeerInbox> inbox_;
  std::atomic<bool> cancelled_{false};
};

extern const sd_bus_vtable kRequestVtable[];
extern const sd_bus_vtable kBusVtable[];

class PeerSession {
 public:
  PeerSession(const ServiceEndpoint& endpoint, std::uint64_t id, std::shared_ptr<PeerInbox> inbox,
              PeerCredentials credentials)
      : endpoint_(endpoint),
        id_(id),
        inbox_(std::move(inbox)),
        connection_(std::make_shared<DBusConnection>(std::move(credentials), inbox_)) {}

  bool start(UniqueFd fd);
  void run();
  const PeerInbox* inbox() const { return inbox_.get(); }
  void execute(PeerCommand& command);

  static int onRequest(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onHello(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onMatch(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onGetNameOwner(sd_bus_message* m, void* userdata, sd_bus_error* error);
#ifdef KESTREL_BENCH_FLOOR
  static int onFloor(sd_bus_message* m, void* userdata, sd_bus_error* error);
#endif

 private:
  int handleRequest(sd_bus_message* m, sd_bus_error* error);
  void sendReply(std::uint64_t requestId, const MessageDictionary& reply);
  bool tooManyUnreadReplies() const;
  void drainInbox();
  bool wait();

  const ServiceEndpoint& endpoint_;
  const std::uint64_t id_;
  const std::shared_ptr<PeerInbox> inbox_;
  const std::shared_ptr<DBusConnection> connection_;
  BusPtr bus_;
  // Declared after the bus: the requests are released before it closes.
  std::map<std::uint64_t, BusMessagePtr> pending_;
  std::uint64_t nextRequestId_ = 1;
  // Set inside an sd-bus callback or by a cancel; the loop ends once it sees it.
  bool closeRequested_ = false;
};

void deliver(const std::shared_ptr<PeerInbox>& inbox, PeerCommand command) {
  PeerSession* session = tCurrentSession;
  if (session != nullptr && session->inbox() == inbox.get()) {
    session->execute(command);
  } else {
    inbox->post(std::move(command));
  }
}

const sd_bus_vtable kRequestVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_ARGS(kMessageRequestMethod, SD_BUS_ARGS("a{sv}", request),
                            SD_BUS_RESULT("a{sv}", reply), PeerSession::onRequest,
                            SD_BUS_VTABLE_UNPRIVILEGED),
#ifdef KESTREL_BENCH_FLOOR
    SD_BUS_METHOD_WITH_ARGS("Floor", SD_BUS_ARGS("a{sv}", request), SD_BUS_RESULT("a{sv}", reply),
                            PeerSession::onFloor, SD_BUS_VTABLE_UNPRIVILEGED),
#endif
    SD_BUS_VTABLE_END,
};

// What a client that believes it talks to a bus asks of it first.
const sd_bus_vtable kBusVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_ARGS("Hello", SD_BUS_NO_ARGS, SD_BUS_RESULT("s", unique_name),
                            PeerSession::onHello, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("GetNameOwner", SD_BUS_ARGS("s", name), SD_BUS_RESULT("s", owner),
                            PeerSession::onGetNameOwner, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("AddMatch", SD_BUS_ARGS("s", rule), SD_BUS_NO_RESULT,
                            PeerSession::onMatch, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("RemoveMatch", SD_BUS_ARGS("s", rule), SD_BUS_NO_RESULT,
                            PeerSession::onMatch, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

bool PeerSession::start(UniqueFd fd) {
  sd_bus* raw = nullptr;
  if (sd_bus_new(&raw) < 0) return false;
  bus_.reset(raw);
  if (sd_bus_set_fd(raw, fd.get(), fd.get()) < 0) return false;
  fd.release();  // the bus closes it from now on
  if (sd_bus_set_server(raw, 1, endpoint_.serverId) < 0) return false;
  if (sd_bus_negotiate_fds(raw, 0) < 0) return false;  // no descriptors from clients
  if (sd_bus_add_object_vtable(raw, nullptr, endpoint_.objectPath.c_str(),
                               endpoint_.serviceName.c_str(), kRequestVtable, this) < 0) {
    return false;
  }
  if (sd_bus_add_object_vtable(raw, nullptr, "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               kBusVtable, this) < 0) {
    return false;
  }
  return sd_bus_start(raw) >= 0;
}

void PeerSession::run() {
  tCurrentSession = this;
  while (!closeRequested_) {
    const int r = sd_bus_process(bus_.get(), nullptr);
    if (r < 0 || closeRequested_) break;
    drainInbox();
    if (r > 0) continue;  // more may be waiting already
    if (closeRequested_ || sd_bus_is_open(bus_.get()) <= 0 || !wait()) break;
  }
  tCurrentSession = nullptr;
  inbox_->close();
  // Requests still waiting for their reply go with the connection; their
  // handlers may still run elsewhere, and their replies are dropped.
}

// Until the socket, a timeout of sd-bus or the inbox has something for us.
bool PeerSession::wait() {
  const int events = sd_bus_get_events(bus_.get());
  std::uint64_t deadline = UINT64_MAX;
  if (events < 0 || sd_bus_get_timeout(bus_.get(), &deadline) < 0) return false;
  int timeoutMs = -1;
  if (deadline != UINT64_MAX) {
    const std::uint64_t now = monotonicUsec();
    const std::uint64_t ms = deadline <= now ? 0 : (deadline - now + 999) / 1000;
    timeoutMs = ms > static_cast<std::uint64_t>(INT_MAX) ? INT_MAX : static_cast<int>(ms);
  }
  struct pollfd fds[2] = {{sd_bus_get_fd(bus_.get()), static_cast<short>(events), 0},
                          {inbox_->fd(), POLLIN, 0}};
  const int r = ::poll(fds, 2, timeoutMs);
  return r >= 0 || errno == EINTR;
}

void PeerSession::drainInbox() {
  std::vector<PeerCommand> commands = inbox_->take();
  if (commands.empty()) return;
  for (PeerCommand& command : commands) execute(command);
  if (tooManyUnreadReplies()) closeRequested_ = true;  // it sends but does not read
}

void PeerSession::execute(PeerCommand& command) {
  switch (command.kind) {
    case PeerCommand::Kind::Reply:
      sendReply(command.requestId, command.reply);
      break;
    case PeerCommand::Kind::Forget:
      pending_.erase(command.requestId);
      break;
    case PeerCommand::Kind::Cancel:
      closeRequested_ = true;
      break;
  }
}

bool PeerSession::tooManyUnreadReplies() const {
  std::uint64_t unread = 0;
  return sd_bus_get_n_queued_write(bus_.get(), &unread) >= 0 && unread > kMaxUnreadReplies;
}

void PeerSession::sendReply(std::uint64_t requestId, const MessageDictionary& reply) {
  auto it = pending_.find(requestId);
  if (it == pending_.end()) return;
  BusMessagePtr request = std::move(it->second);
  pending_.erase(it);

  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_return(request.get(), &raw);
  BusMessagePtr message(raw);
  if (r >= 0) r = appendDictionary(message.get(), reply);
  if (r < 0) {
    sd_bus_reply_method_errorf(request.get(), SD_BUS_ERROR_FAILED,
                               "The reply could not be encoded: %s", std::strerror(-r));
    return;
  }
  sd_bus_send(bus_.get(), message.get(), nullptr);
}

int PeerSession::onRequest(sd_bus_message* m, void* userdata, sd_bus_error* error) {
  return static_cast<PeerSession*>(userdata)->handleRequest(m, error);
}

int PeerSession::handleRequest(sd_bus_message* m, sd_bus_error* error) {
  if (tooManyUnreadReplies()) {
    closeRequested_ = true;  // it sends but does not read
    return 1;
  }
  if (pending_.size() >= kMaxRequestsInFlight) {
    return sd_bus_error_set(error, SD_BUS_ERROR_LIMITS_EXCEEDED,
                            "Too many requests in flight on this connection");
  }
  MessageDictionary dictionary;
  const int r = readDictionary(m, &dictionary);
  if (r < 0) {
    return sd_bus_error_setf(error, SD_BUS_ERROR_INVALID_ARGS, "Malformed request: %s",
                             std::strerror(-r));
  }

  std::shared_ptr<MessageReplyContext> context;
  if (sd_bus_message_get_expect_reply(m) > 0) {
    const std::uint64_t requestId = nextRequestId_++;
    pending_.emplace(requestId, BusMessagePtr(sd_bus_message_ref(m)));
    context = std::make_shared<DBusReplyContext>(inbox_, requestId);
  }
  // Run here, as an item of the listener's queue (held back while that queue
  // is suspended); a reply made meanwhile is sent right away.
  ReceivedMessage message(std::move(dictionary), std::move(context), connection_);
  endpoint_.queue->sync([&] { endpoint_.handler(connection_, std::move(message)); });
  return 1;  // answered by now, later, or never when no reply is expected
}

int PeerSession::onHello(sd_bus_message* m, void* userdata, sd_bus_error* /*error*/) {
  auto* session = static_cast<PeerSession*>(userdata);
  const std::string name = ":1." + std::to_string(session->id_);
  return sd_bus_reply_method_return(m, "s", name.c_str());
}

int PeerSession::onGetNameOwner(sd_bus_message* m, void* userdata, sd_bus_error* error) {
  // Clients that resolve the service name first (dbus-python) learn that the
  // other end of this connection owns it.
  auto* session = static_cast<PeerSession*>(userdata);
  const char* name = nullptr;
  const int r = sd_bus_message_read(m, "s", &name);
  if (r < 0) return r;
  if (session->endpoint_.serviceName != name) {
    return sd_bus_error_setf(error, SD_BUS_ERROR_NAME_HAS_NO_OWNER, "No owner for name %s", name);
  }
  return sd_bus_reply_method_return(m, "s", ":1.0");
}

#ifdef KESTREL_BENCH_FLOOR
// The request benchmark's floor: a request decoded and a reply of a found
// container's shape encoded and sent, on this thread, with no work between.
int PeerSession::onFloor(sd_bus_message* m, void* /*userdata*/, sd_bus_error* error) {
  MessageDictionary request;
  int r = readDictionary(m, &request);
  if (r < 0) return sd_bus_error_set_errno(error, r);
  MessageDictionary reply;
  reply.setUint64("ReplyError", 1);
  reply.setUuid("ReplyUUID", Uuid{});
  reply.setBoolean("ReplyExisted", true);
  reply.setString("ReplyPath",
                  "/private/var/mobile/Containers/Data/Application/"
                  "00000000-0000-0000-0000-000000000000");
  reply.setString("ReplyIdentifier", request.string("Identifier").value_or(""));
  sd_bus_message* raw = nullptr;
  r = sd_bus_message_new_method_return(m, &raw);
  BusMessagePtr message(raw);
  if (r >= 0) r = appendDictionary(message.get(), reply);
  if (r >= 0) r = sd_bus_send(nullptr, message.get(), nullptr);
  return r < 0 ? sd_bus_error_set_errno(error, r) : 1;
}
#endif

int PeerSession::onMatch(sd_bus_message* m, void* /*userdata*/, sd_bus_error* /*error*/) {
  // No signals are sent, so match rules have nothing to select.
  return sd_bus_reply_method_return(m, "");
}

}  // namespace

std::shared_ptr<PeerInbox> PeerInbox::create() {
  UniqueFd fd(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!fd) return nullptr;
  return std::make_shared<PeerInbox>(std::move(fd));
}

void PeerInbox::post(PeerCommand command) {
  // The wake-up is set under the lock, so that it is set exactly while
  // commands are waiting.
  std::lock_guard lock(mutex_);
  if (closed_) return;
  commands_.push_back(std::move(command));
  const std::uint64_t one = 1;
  [[maybe_unused]] ssize_t written = ::write(wakeFd_.get(), &one, sizeof one);
}

std::vector<PeerCommand> PeerInbox::take() {
  std::vector<PeerCommand> commands;
  std::lock_guard lock(mutex_);
  if (commands_.empty()) return commands;
  std::uint64_t value = 0;
  [[maybe_unused]] ssize_t readBytes = ::read(wakeFd_.get(), &value, sizeof value);
  commands.swap(commands_);
  return commands;
}

void PeerInbox::close() {
  std::lock_guard lock(mutex_);
  closed_ = true;
  commands_.clear();
}

void servePeer(const ServiceEndpoint& endpoint, std::uint64_t id, UniqueFd fd,
               PeerCredentials credentials, std::shared_ptr<PeerInbox> inbox) {
  ::pthread_setname_np(::pthread_self(), "kestrel-conn");
  PeerSession session(endpoint, id, std::move(inbox), std::move(credentials));
  if (session.start(std::move(fd))) session.run();
}

}  // namespace kestrel::platform::dbus
