#include "platform/linux/dbus_listener.h"

#include <poll.h>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>
#include <time.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <deque>
#include <filesystem>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch_pool.h"
#include "platform/linux/dbus_message_codec.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// Connections beyond this are closed as soon as they are accepted.
constexpr std::size_t kMaxConnections = 1024;
// Requests of one connection that are queued, being handled or awaiting their
// reply; a request beyond this is answered at once with LimitsExceeded.
constexpr std::size_t kMaxRequestsInFlight = 1024;
// Replies a peer has not read yet; a peer that lets more pile up is closed.
constexpr std::uint64_t kMaxUnreadReplies = 1024;
// sd_bus_process() rounds per connection before the others get their turn.
constexpr int kMaxDispatchPerWake = 64;
// How long accepting pauses when the process is out of descriptors.
constexpr std::uint64_t kAcceptRetryUsec = 100'000;

constexpr std::uint64_t kListenToken = UINT64_MAX;
constexpr std::uint64_t kWakeToken = UINT64_MAX - 1;

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

std::string errnoText(const std::string& what, int error) {
  return what + ": " + std::strerror(error);
}

class ListenerCore;

// What the IPC thread is asked to do by other threads.
struct Command {
  enum class Kind { Reply, Forget, Cancel };
  Kind kind;
  std::uint64_t connectionId;
  std::uint64_t requestId;
  MessageDictionary reply;
};

// Names one request awaiting its reply. When the last copy of the received
// message goes without a reply, the IPC thread forgets the request.
class DBusReplyContext final : public MessageReplyContext {
 public:
  DBusReplyContext(std::weak_ptr<ListenerCore> core, std::uint64_t connectionId,
                   std::uint64_t requestId)
      : core_(std::move(core)), connectionId_(connectionId), requestId_(requestId) {}
  ~DBusReplyContext() override;

  std::uint64_t connectionId() const { return connectionId_; }
  std::uint64_t requestId() const { return requestId_; }
  // True for the one caller that may answer.
  bool claim() { return !answered_.exchange(true); }

 private:
  std::weak_ptr<ListenerCore> core_;
  std::uint64_t connectionId_;
  std::uint64_t requestId_;
  std::atomic<bool> answered_{false};
};

class DBusConnection final : public MessageConnection {
 public:
  DBusConnection(std::weak_ptr<ListenerCore> core, std::uint64_t id, PeerCredentials peer,
                 std::shared_ptr<DispatchQueue> queue)
      : core_(std::move(core)), id_(id), peer_(std::move(peer)), queue_(std::move(queue)) {}

  const PeerCredentials& peerCredentials() const override { return peer_; }
  void cancel() override;
  bool sendReply(const ReceivedMessage& request, MessageDictionary reply) override;

  std::uint64_t id() const { return id_; }
  DispatchQueue& queue() const { return *queue_; }
  // Requests handed to the queue whose handler has not returned yet.
  std::atomic<std::size_t> queued{0};

 private:
  std::weak_ptr<ListenerCore> core_;
  std::uint64_t id_;
  PeerCredentials peer_;
  std::shared_ptr<DispatchQueue> queue_;
  std::atomic<bool> cancelled_{false};
};

// One accepted connection; touched only by the IPC thread.
struct Peer {
  ListenerCore* core = nullptr;
  std::uint64_t id = 0;
  int fd = -1;  // owned by the bus
  std::uint32_t watched = 0;
  std::uint64_t deadline = UINT64_MAX;  // CLOCK_MONOTONIC usec; UINT64_MAX: none
  std::shared_ptr<DBusConnection> connection;
  BusPtr bus;
  // Declared after the bus: the requests are released before it closes.
  std::map<std::uint64_t, BusMessagePtr> pending;
  std::uint64_t nextRequestId = 1;
  // Set inside an sd-bus callback; the connection is closed once it returns.
  bool closeRequested = false;
};

class ListenerCore : public std::enable_shared_from_this<ListenerCore> {
 public:
  ListenerCore(std::string serviceName, std::string socketPath,
               std::shared_ptr<DispatchQueue> queue, MessageHandler handler)
      : serviceName_(std::move(serviceName)),
        socketPath_(std::move(socketPath)),
        objectPath_(messageServiceObjectPath(serviceName_)),
        queue_(std::move(queue)),
        handler_(std::make_shared<const MessageHandler>(std::move(handler))) {}

  ~ListenerCore() { stop(); }

  const std::string& serviceName() const { return serviceName_; }
  bool open(std::string* errorText);
  void start();
  void stop();
  // From any thread.
  void post(Command command);

  // sd-bus callbacks, on the IPC thread.
  static int onRequest(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onHello(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onMatch(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onGetNameOwner(sd_bus_message* m, void* userdata, sd_bus_error* error);

 private:
  void run();
  bool stopping();
  void wake();
  void acceptPending();
  bool addPeer(UniqueFd fd);
  void processPeer(std::uint64_t id);
  void updateWatch(Peer& peer);
  void closePeer(std::uint64_t id);
  void drainCommands();
  void sendReply(Peer& peer, std::uint64_t requestId, const MessageDictionary& reply);
  static bool tooManyUnreadReplies(Peer& peer);
  int handleRequest(Peer& peer, sd_bus_message* m, sd_bus_error* error);
  int epollTimeoutMs() const;

  const std::string serviceName_;
  const std::string socketPath_;
  const std::string objectPath_;
  const std::shared_ptr<DispatchQueue> queue_;
  const std::shared_ptr<const MessageHandler> handler_;

  UniqueFd listenFd_;
  UniqueFd epollFd_;
  UniqueFd wakeFd_;
  struct stat socketStat_ = {};
  sd_id128_t serverId_ = {};

  // Shared with other threads.
  std::mutex mutex_;
  std::deque<Command> commands_;
  bool started_ = false;
  bool stopping_ = false;
  std::thread thread_;

  // The IPC thread's own.
  std::map<std::uint64_t, std::unique_ptr<Peer>> peers_;
  std::uint64_t nextPeerId_ = 1;
  bool acceptPaused_ = false;
  std::uint64_t acceptRetryAt_ = UINT64_MAX;
};

const sd_bus_vtable kRequestVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_ARGS(kMessageRequestMethod, SD_BUS_ARGS("a{sv}", request),
                            SD_BUS_RESULT("a{sv}", reply), ListenerCore::onRequest,
                            SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

// What a client that believes it talks to a bus asks of it first.
const sd_bus_vtable kBusVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_ARGS("Hello", SD_BUS_NO_ARGS, SD_BUS_RESULT("s", unique_name),
                            ListenerCore::onHello, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("GetNameOwner", SD_BUS_ARGS("s", name), SD_BUS_RESULT("s", owner),
                            ListenerCore::onGetNameOwner, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("AddMatch", SD_BUS_ARGS("s", rule), SD_BUS_NO_RESULT,
                            ListenerCore::onMatch, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD_WITH_ARGS("RemoveMatch", SD_BUS_ARGS("s", rule), SD_BUS_NO_RESULT,
                            ListenerCore::onMatch, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

// ---------------------------------------------------------------------------
// Contexts and connections: any thread.

DBusReplyContext::~DBusReplyContext() {
  if (answered_.load()) return;
  if (auto core = core_.lock()) {
    core->post(Command{Command::Kind::Forget, connectionId_, requestId_, {}});
  }
}

void DBusConnection::cancel() {
  if (cancelled_.exchange(true)) return;
  if (auto core = core_.lock()) core->post(Command{Command::Kind::Cancel, id_, 0, {}});
}

bool DBusConnection::sendReply(const ReceivedMessage& request, MessageDictionary reply) {
  auto* context = dynamic_cast<DBusReplyContext*>(request.replyContext().get());
  if (context == nullptr || context->connectionId() != id_) return false;
  if (cancelled_.load() || !context->claim()) return false;
  auto core = core_.lock();
  if (!core) return false;
  core->post(Command{Command::Kind::Reply, id_, context->requestId(), std::move(reply)});
  return true;
}

// ---------------------------------------------------------------------------
// Set-up and tear-down.

bool ListenerCore::open(std::string* errorText) {
  auto fail = [&](const std::string& text) {
    if (errorText != nullptr) *errorText = text;
    return false;
  };
  if (sd_bus_interface_name_is_valid(serviceName_.c_str()) <= 0 ||
      sd_bus_object_path_is_valid(objectPath_.c_str()) <= 0) {
    return fail("not a valid service name: " + serviceName_);
  }
  const std::filesystem::path directory = std::filesystem::path(socketPath_).parent_path();
  std::error_code ec;
  std::filesystem::create_directories(directory, ec);
  if (ec) return fail(errnoText("cannot make " + directory.string(), ec.value()));
  ::chmod(directory.c_str(), 0755);

  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (socketPath_.size() >= sizeof address.sun_path) {
    return fail(errnoText("socket path too long: " + socketPath_, ENAMETOOLONG));
  }
  std::memcpy(address.sun_path, socketPath_.c_str(), socketPath_.size() + 1);
  const auto* sockaddr = reinterpret_cast<const struct sockaddr*>(&address);

  // A socket that still answers belongs to a listener that is alive: leave it.
  {
    UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (probe && ::connect(probe.get(), sockaddr, sizeof address) == 0) {
      return fail("another listener serves " + socketPath_);
    }
  }
  ::unlink(socketPath_.c_str());  // left by an earlier run

  listenFd_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!listenFd_) return fail(errnoText("socket", errno));
  if (::bind(listenFd_.get(), sockaddr, sizeof address) != 0) {
    return fail(errnoText("bind " + socketPath_, errno));
  }
  // Anyone may connect: clients are admitted by their entitlements.
  if (::chmod(socketPath_.c_str(), 0666) != 0 || ::stat(socketPath_.c_str(), &socketStat_) != 0) {
    return fail(errnoText("chmod " + socketPath_, errno));
  }
  if (::listen(listenFd_.get(), SOMAXCONN) != 0) return fail(errnoText("listen", errno));

  epollFd_.reset(::epoll_create1(EPOLL_CLOEXEC));
  if (!epollFd_) return fail(errnoText("epoll_create1", errno));
  wakeFd_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wakeFd_) return fail(errnoText("eventfd", errno));
  struct epoll_event event = {};
  event.events = EPOLLIN;
  event.data.u64 = kListenToken;
  if (::epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, listenFd_.get(), &event) != 0) {
    return fail(errnoText("epoll_ctl", errno));
  }
  event.data.u64 = kWakeToken;
  if (::epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, wakeFd_.get(), &event) != 0) {
    return fail(errnoText("epoll_ctl", errno));
  }
  const int r = sd_id128_randomize(&serverId_);
  if (r < 0) return fail(errnoText("sd_id128_randomize", -r));
  return true;
}

void ListenerCore::start() {
  std::lock_guard lock(mutex_);
  if (started_ || stopping_) return;
  try {
    // The thread keeps the core alive until it has closed every connection.
    thread_ = dispatch_detail::startThread([self = shared_from_this()] { self->run(); });
    started_ = true;
  } catch (const std::exception&) {
    // No thread: the listener stays suspended.
  }
}

void ListenerCore::stop() {
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
    commands_.clear();
  }
  if (thread_.joinable()) {
    wake();
    if (thread_.get_id() == std::this_thread::get_id()) {
      thread_.detach();  // let go from inside the IPC thread: it ends by itself
    } else {
      thread_.join();
    }
  }
  // Remove the socket only if it is still ours and not a later listener's.
  struct stat now = {};
  if (listenFd_ && ::stat(socketPath_.c_str(), &now) == 0 && now.st_ino == socketStat_.st_ino &&
      now.st_dev == socketStat_.st_dev) {
    ::unlink(socketPath_.c_str());
  }
}

bool ListenerCore::stopping() {
  std::lock_guard lock(mutex_);
  return stopping_;
}

void ListenerCore::post(Command command) {
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    commands_.push_back(std::move(command));
  }
  wake();
}

void ListenerCore::wake() {
  const std::uint64_t one = 1;
  [[maybe_unused]] ssize_t written = ::write(wakeFd_.get(), &one, sizeof one);
}

// ---------------------------------------------------------------------------
// The IPC thread.

void ListenerCore::run() {
  ::pthread_setname_np(::pthread_self(), "kestrel-ipc");
  std::vector<struct epoll_event> events(64);
  while (!stopping()) {
    const int count = ::epoll_wait(epollFd_.get(), events.data(), static_cast<int>(events.size()),
                                   epollTimeoutMs());
    if (count < 0 && errno != EINTR) break;
    std::set<std::uint64_t> processed;
    for (int i = 0; i < count; ++i) {
      const std::uint64_t token = events[static_cast<std::size_t>(i)].data.u64;
      if (token == kListenToken) {
        acceptPending();
      } else if (token == kWakeToken) {
        drainCommands();
      } else if (processed.insert(token).second) {
        processPeer(token);
      }
    }
    // Connections whose sd-bus asked to be called again by now: queued
    // messages already read, or a timeout.
    const std::uint64_t now = monotonicUsec();
    std::vector<std::uint64_t> due;
    for (const auto& [id, peer] : peers_) {
      if (peer->deadline <= now && processed.count(id) == 0) due.push_back(id);
    }
    for (std::uint64_t id : due) processPeer(id);
    if (acceptPaused_ && acceptRetryAt_ <= now) {
      struct epoll_event event = {};
      event.events = EPOLLIN;
      event.data.u64 = kListenToken;
      if (::epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, listenFd_.get(), &event) == 0) {
        acceptPaused_ = false;
        acceptRetryAt_ = UINT64_MAX;
      }
    }
  }
  // Requests still waiting for a reply are dropped with their connections.
  peers_.clear();
}

int ListenerCore::epollTimeoutMs() const {
  std::uint64_t deadline = acceptRetryAt_;
  for (const auto& [id, peer] : peers_) deadline = std::min(deadline, peer->deadline);
  if (deadline == UINT64_MAX) return -1;
  const std::uint64_t now = monotonicUsec();
  if (deadline <= now) return 0;
  const std::uint64_t ms = (deadline - now + 999) / 1000;
  return ms > static_cast<std::uint64_t>(INT_MAX) ? INT_MAX : static_cast<int>(ms);
}

void ListenerCore::acceptPending() {
  for (;;) {
    const int fd = ::accept4(listenFd_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        // The backlog keeps the socket readable: stop watching it for a while
        // rather than spin.
        ::epoll_ctl(epollFd_.get(), EPOLL_CTL_DEL, listenFd_.get(), nullptr);
        acceptPaused_ = true;
        acceptRetryAt_ = monotonicUsec() + kAcceptRetryUsec;
      }
      return;
    }
    UniqueFd connection(fd);
    if (peers_.size() >= kMaxConnections) continue;
    addPeer(std::move(connection));
  }
}

bool ListenerCore::addPeer(UniqueFd fd) {
  auto peer = std::make_unique<Peer>();
  peer->core = this;
  peer->id = nextPeerId_++;
  peer->fd = fd.get();

  // Who connected, before anything of theirs is read.
  PeerCredentials credentials = readPeerCredentials(fd.get());

  auto queue = DispatchQueue::createSerial(serviceName_ + ".peer." + std::to_string(peer->id));
  if (!queue) return false;
  queue->setTarget(queue_);
  peer->connection = std::make_shared<DBusConnection>(weak_from_this(), peer->id,
                                                      std::move(credentials), std::move(queue));

  sd_bus* raw = nullptr;
  if (sd_bus_new(&raw) < 0) return false;
  peer->bus.reset(raw);
  if (sd_bus_set_fd(raw, fd.get(), fd.get()) < 0) return false;
  fd.release();  // the bus closes it from now on
  if (sd_bus_set_server(raw, 1, serverId_) < 0) return false;
  if (sd_bus_negotiate_fds(raw, 0) < 0) return false;  // no descriptors from clients
  if (sd_bus_add_object_vtable(raw, nullptr, objectPath_.c_str(), serviceName_.c_str(),
                               kRequestVtable, peer.get()) < 0) {
    return false;
  }
  if (sd_bus_add_object_vtable(raw, nullptr, "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               kBusVtable, peer.get()) < 0) {
    return false;
  }
  if (sd_bus_start(raw) < 0) return false;

  struct epoll_event event = {};
  event.events = EPOLLIN;
  event.data.u64 = peer->id;
  if (::epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, peer->fd, &event) != 0) return false;
  peer->watched = EPOLLIN;
  const std::uint64_t id = peer->id;
  peers_.emplace(id, std::move(peer));
  processPeer(id);
  return true;
}

void ListenerCore::processPeer(std::uint64_t id) {
  auto it = peers_.find(id);
  if (it == peers_.end()) return;
  Peer& peer = *it->second;
  int r = 0;
  for (int round = 0; round < kMaxDispatchPerWake; ++round) {
    r = sd_bus_process(peer.bus.get(), nullptr);
    if (r <= 0 || peer.closeRequested) break;
  }
  if (r < 0 || peer.closeRequested || sd_bus_is_open(peer.bus.get()) <= 0) {
    closePeer(id);
    return;
  }
  updateWatch(peer);
}

void ListenerCore::updateWatch(Peer& peer) {
  const int events = sd_bus_get_events(peer.bus.get());
  std::uint64_t deadline = UINT64_MAX;
  if (events < 0 || sd_bus_get_timeout(peer.bus.get(), &deadline) < 0) {
    closePeer(peer.id);
    return;
  }
  peer.deadline = deadline;
  std::uint32_t wanted = 0;
  if (events & POLLIN) wanted |= EPOLLIN;
  if (events & POLLOUT) wanted |= EPOLLOUT;
  if (wanted == peer.watched) return;
  struct epoll_event event = {};
  event.events = wanted;
  event.data.u64 = peer.id;
  if (::epoll_ctl(epollFd_.get(), EPOLL_CTL_MOD, peer.fd, &event) != 0) {
    closePeer(peer.id);
    return;
  }
  peer.watched = wanted;
}

void ListenerCore::closePeer(std::uint64_t id) {
  auto it = peers_.find(id);
  if (it == peers_.end()) return;
  ::epoll_ctl(epollFd_.get(), EPOLL_CTL_DEL, it->second->fd, nullptr);
  // Requests still waiting for their reply go with it; their handlers may
  // still run, and their replies are dropped.
  peers_.erase(it);
}

void ListenerCore::drainCommands() {
  std::uint64_t value = 0;
  [[maybe_unused]] ssize_t readBytes = ::read(wakeFd_.get(), &value, sizeof value);
  std::deque<Command> commands;
  {
    std::lock_guard lock(mutex_);
    commands.swap(commands_);
  }
  std::set<std::uint64_t> touched;
  for (Command& command : commands) {
    auto it = peers_.find(command.connectionId);
    if (it == peers_.end()) continue;
    switch (command.kind) {
      case Command::Kind::Reply:
        sendReply(*it->second, command.requestId, command.reply);
        touched.insert(command.connectionId);
        break;
      case Command::Kind::Forget:
        it->second->pending.erase(command.requestId);
        break;
      case Command::Kind::Cancel:
        closePeer(command.connectionId);
        break;
    }
  }
  // Let sd-bus write what did not fit at once and watch for the rest.
  for (std::uint64_t id : touched) {
    auto it = peers_.find(id);
    if (it == peers_.end()) continue;
    if (tooManyUnreadReplies(*it->second)) {
      closePeer(id);  // it sends but does not read
    } else {
      processPeer(id);
    }
  }
}

bool ListenerCore::tooManyUnreadReplies(Peer& peer) {
  std::uint64_t unread = 0;
  return sd_bus_get_n_queued_write(peer.bus.get(), &unread) >= 0 && unread > kMaxUnreadReplies;
}

void ListenerCore::sendReply(Peer& peer, std::uint64_t requestId, const MessageDictionary& reply) {
  auto it = peer.pending.find(requestId);
  if (it == peer.pending.end()) return;
  BusMessagePtr request = std::move(it->second);
  peer.pending.erase(it);

  sd_bus_message* raw = nullptr;
  int r = sd_bus_message_new_method_return(request.get(), &raw);
  BusMessagePtr message(raw);
  if (r >= 0) r = dbus::appendDictionary(message.get(), reply);
  if (r < 0) {
    sd_bus_reply_method_errorf(request.get(), SD_BUS_ERROR_FAILED,
                               "The reply could not be encoded: %s", std::strerror(-r));
    return;
  }
  sd_bus_send(peer.bus.get(), message.get(), nullptr);
}

int ListenerCore::onRequest(sd_bus_message* m, void* userdata, sd_bus_error* error) {
  auto* peer = static_cast<Peer*>(userdata);
  return peer->core->handleRequest(*peer, m, error);
}

int ListenerCore::handleRequest(Peer& peer, sd_bus_message* m, sd_bus_error* error) {
  if (tooManyUnreadReplies(peer)) {
    peer.closeRequested = true;  // it sends but does not read
    return 1;
  }
  if (peer.connection->queued.load() >= kMaxRequestsInFlight ||
      peer.pending.size() >= kMaxRequestsInFlight) {
    return sd_bus_error_set(error, SD_BUS_ERROR_LIMITS_EXCEEDED,
                            "Too many requests in flight on this connection");
  }
  MessageDictionary dictionary;
  const int r = dbus::readDictionary(m, &dictionary);
  if (r < 0) {
    return sd_bus_error_setf(error, SD_BUS_ERROR_INVALID_ARGS, "Malformed request: %s",
                             std::strerror(-r));
  }

  std::shared_ptr<MessageReplyContext> context;
  if (sd_bus_message_get_expect_reply(m) > 0) {
    const std::uint64_t requestId = peer.nextRequestId++;
    peer.pending.emplace(requestId, BusMessagePtr(sd_bus_message_ref(m)));
    context = std::make_shared<DBusReplyContext>(weak_from_this(), peer.id, requestId);
  }
  std::shared_ptr<DBusConnection> connection = peer.connection;
  ReceivedMessage message(std::move(dictionary), std::move(context), connection);
  connection->queued.fetch_add(1);
  connection->queue().async(
      [handler = handler_, connection, message = std::move(message)]() mutable {
        struct Done {
          DBusConnection& connection;
          ~Done() { connection.queued.fetch_sub(1); }
        } done{*connection};
        (*handler)(connection, std::move(message));
      });
  return 1;  // answered later, or never when no reply is expected
}

int ListenerCore::onHello(sd_bus_message* m, void* userdata, sd_bus_error* /*error*/) {
  auto* peer = static_cast<Peer*>(userdata);
  const std::string name = ":1." + std::to_string(peer->id);
  return sd_bus_reply_method_return(m, "s", name.c_str());
}

int ListenerCore::onGetNameOwner(sd_bus_message* m, void* userdata, sd_bus_error* error) {
  // Clients that resolve the service name first (dbus-python) learn that the
  // other end of this connection owns it.
  auto* peer = static_cast<Peer*>(userdata);
  const char* name = nullptr;
  const int r = sd_bus_message_read(m, "s", &name);
  if (r < 0) return r;
  if (peer->core->serviceName_ != name) {
    return sd_bus_error_setf(error, SD_BUS_ERROR_NAME_HAS_NO_OWNER, "No owner for name %s", name);
  }
  return sd_bus_reply_method_return(m, "s", ":1.0");
}

int ListenerCore::onMatch(sd_bus_message* m, void* /*userdata*/, sd_bus_error* /*error*/) {
  // No signals are sent, so match rules have nothing to select.
  return sd_bus_reply_method_return(m, "");
}

// ---------------------------------------------------------------------------

class DBusListener final : public MessageListener {
 public:
  explicit DBusListener(std::shared_ptr<ListenerCore> core) : core_(std::move(core)) {}
  ~DBusListener() override { core_->stop(); }
  const std::string& serviceName() const override { return core_->serviceName(); }
  void resume() override { core_->start(); }

 private:
  std::shared_ptr<ListenerCore> core_;
};

class LinuxMessageIPC final : public MessageIPC {
 public:
  explicit LinuxMessageIPC(FilesystemRoot root) : root_(std::move(root)) {}

  std::shared_ptr<MessageListener> createListener(const std::string& serviceName,
                                                  std::shared_ptr<DispatchQueue> queue,
                                                  MessageHandler handler,
                                                  std::string* errorText) override {
    if (!queue || !handler) {
      if (errorText != nullptr) *errorText = "a listener needs a queue and a handler";
      return nullptr;
    }
    if (serviceName.empty() || serviceName.find('/') != std::string::npos) {
      if (errorText != nullptr) *errorText = "not a valid service name: " + serviceName;
      return nullptr;
    }
    auto core =
        std::make_shared<ListenerCore>(serviceName, messageServiceSocketPath(root_, serviceName),
                                       std::move(queue), std::move(handler));
    if (!core->open(errorText)) return nullptr;
    return std::make_shared<DBusListener>(std::move(core));
  }

 private:
  FilesystemRoot root_;
};

}  // namespace

std::shared_ptr<MessageIPC> makeLinuxMessageIPC(const FilesystemRoot& root) {
  return std::make_shared<LinuxMessageIPC>(root);
}

std::string messageServiceSocketPath(const FilesystemRoot& root, const std::string& serviceName) {
  return root.resolve("/run/kestrel") + "/" + serviceName;
}

std::string messageServiceObjectPath(const std::string& serviceName) {
  std::string path = "/";
  for (char c : serviceName) {
    const bool plain =
        (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
    path += c == '.' ? '/' : (plain ? c : '_');
  }
  return path;
}

}  // namespace kestrel::platform
