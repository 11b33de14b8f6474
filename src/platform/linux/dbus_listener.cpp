#include "platform/linux/dbus_listener.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <functional>
#include <map>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch_pool.h"
#include "platform/linux/dbus_peer_session.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// Connections beyond this are closed as soon as they are accepted.
constexpr std::size_t kMaxConnections = 1024;
// How long accepting pauses when the process is out of descriptors.
constexpr int kAcceptRetryMs = 100;

std::string errnoText(const std::string& what, int error) {
  return what + ": " + std::strerror(error);
}

// The threads of the accepted connections, each with its inbox. Shared with
// the threads themselves, so that a thread that outlives the listener (it was
// stopped from one of its own handlers) still has somewhere to report to.
class PeerThreads {
 public:
  // False when stopping, full, or no thread could be started.
  bool start(std::uint64_t id, std::shared_ptr<dbus::PeerInbox> inbox, std::function<void()> body) {
    std::lock_guard lock(mutex_);
    if (stopping_ || peers_.size() >= kMaxConnections) return false;
    Peer& peer = peers_[id];
    peer.inbox = std::move(inbox);
    try {
      peer.thread = dispatch_detail::startThread(std::move(body));
    } catch (const std::exception&) {
      peers_.erase(id);
      return false;
    }
    return true;
  }

  // Called by a connection's thread as the last thing it does.
  void finished(std::uint64_t id) {
    std::lock_guard lock(mutex_);
    auto it = peers_.find(id);
    if (it != peers_.end()) it->second.finished = true;
  }

  // Joins the threads of connections that have closed.
  void reap() {
    std::vector<std::thread> done;
    {
      std::lock_guard lock(mutex_);
      for (auto it = peers_.begin(); it != peers_.end();) {
        if (it->second.finished) {
          done.push_back(std::move(it->second.thread));
          it = peers_.erase(it);
        } else {
          ++it;
        }
      }
    }
    for (std::thread& thread : done) thread.join();
  }

  // Cancels every connection and waits for its thread to end: a handler
  // that is running finishes first. The calling thread, when it serves a
  // connection itself, is let go and ends by itself.
  void stopAll() {
    std::map<std::uint64_t, Peer> peers;
    {
      std::lock_guard lock(mutex_);
      stopping_ = true;
      peers.swap(peers_);
    }
    for (auto& [id, peer] : peers) {
      peer.inbox->post(dbus::PeerCommand{dbus::PeerCommand::Kind::Cancel, 0, {}});
    }
    for (auto& [id, peer] : peers) {
      if (peer.thread.get_id() == std::this_thread::get_id()) {
        peer.thread.detach();
      } else {
        peer.thread.join();
      }
    }
  }

 private:
  struct Peer {
    std::shared_ptr<dbus::PeerInbox> inbox;
    std::thread thread;
    bool finished = false;
  };
  std::mutex mutex_;
  std::map<std::uint64_t, Peer> peers_;
  bool stopping_ = false;
};

class ListenerCore {
 public:
  ListenerCore(std::string serviceName, std::string socketPath,
               std::shared_ptr<DispatchQueue> queue, MessageHandler handler)
      : socketPath_(std::move(socketPath)), endpoint_(std::make_shared<dbus::ServiceEndpoint>()) {
    endpoint_->serviceName = std::move(serviceName);
    endpoint_->objectPath = messageServiceObjectPath(endpoint_->serviceName);
    endpoint_->queue = std::move(queue);
    endpoint_->handler = std::move(handler);
  }
  ~ListenerCore() { stop(); }

  const std::string& serviceName() const { return endpoint_->serviceName; }
  bool open(std::string* errorText);
  void start();
  void stop();

 private:
  void acceptLoop();
  void acceptPending();
  void addPeer(UniqueFd fd);

  const std::string socketPath_;
  const std::shared_ptr<dbus::ServiceEndpoint> endpoint_;
  const std::shared_ptr<PeerThreads> peers_ = std::make_shared<PeerThreads>();

  UniqueFd listenFd_;
  UniqueFd stopFd_;
  struct stat socketStat_ = {};

  std::mutex mutex_;
  bool started_ = false;
  bool stopping_ = false;
  std::thread acceptor_;

  // The accepting thread's own.
  std::uint64_t nextPeerId_ = 1;
  bool acceptPaused_ = false;
};

// ---------------------------------------------------------------------------
// Set-up and tear-down.

bool ListenerCore::open(std::string* errorText) {
  auto fail = [&](const std::string& text) {
    if (errorText != nullptr) *errorText = text;
    return false;
  };
  if (sd_bus_interface_name_is_valid(endpoint_->serviceName.c_str()) <= 0 ||
      sd_bus_object_path_is_valid(endpoint_->objectPath.c_str()) <= 0) {
    return fail("not a valid service name: " + endpoint_->serviceName);
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

  stopFd_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!stopFd_) return fail(errnoText("eventfd", errno));
  const int r = sd_id128_randomize(&endpoint_->serverId);
  if (r < 0) return fail(errnoText("sd_id128_randomize", -r));
  return true;
}

void ListenerCore::start() {
  std::lock_guard lock(mutex_);
  if (started_ || stopping_) return;
  try {
    acceptor_ = dispatch_detail::startThread([this] { acceptLoop(); });
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
  }
  if (acceptor_.joinable()) {
    const std::uint64_t one = 1;
    [[maybe_unused]] ssize_t written = ::write(stopFd_.get(), &one, sizeof one);
    acceptor_.join();
  }
  peers_->stopAll();
  // Remove the socket only if it is still ours and not a later listener's.
  struct stat now = {};
  if (listenFd_ && ::stat(socketPath_.c_str(), &now) == 0 && now.st_ino == socketStat_.st_ino &&
      now.st_dev == socketStat_.st_dev) {
    ::unlink(socketPath_.c_str());
  }
}

// ---------------------------------------------------------------------------
// The accepting thread.

void ListenerCore::acceptLoop() {
  ::pthread_setname_np(::pthread_self(), "kestrel-ipc");
  for (;;) {
    struct pollfd fds[2] = {{stopFd_.get(), POLLIN, 0},
                            {acceptPaused_ ? -1 : listenFd_.get(), POLLIN, 0}};
    const int count = ::poll(fds, 2, acceptPaused_ ? kAcceptRetryMs : -1);
    if (count < 0 && errno != EINTR) break;
    if (fds[0].revents != 0) break;
    acceptPaused_ = false;
    peers_->reap();
    if (count > 0 && fds[1].revents != 0) acceptPending();
  }
}

void ListenerCore::acceptPending() {
  for (;;) {
    const int fd = ::accept4(listenFd_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      // Out of descriptors: the backlog keeps the socket readable, so stop
      // watching it for a while rather than spin.
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        acceptPaused_ = true;
      }
      return;
    }
    addPeer(UniqueFd(fd));
  }
}

void ListenerCore::addPeer(UniqueFd fd) {
  // Who connected, before anything of theirs is read.
  PeerCredentials credentials = readPeerCredentials(fd.get());
  auto inbox = dbus::PeerInbox::create();
  if (!inbox) return;
  const std::uint64_t id = nextPeerId_++;
  // The thread shares the endpoint and the thread list, not the listener: it
  // may outlive the listener when stopped from one of its own handlers.
  auto body = [endpoint = endpoint_, peers = peers_, id, inbox,
               fd = std::make_shared<UniqueFd>(std::move(fd)),
               credentials = std::move(credentials)]() mutable {
    dbus::servePeer(*endpoint, id, std::move(*fd), std::move(credentials), std::move(inbox));
    peers->finished(id);
  };
  peers_->start(id, inbox, std::move(body));  // closed when it cannot start
}

// ---------------------------------------------------------------------------

class DBusListener final : public MessageListener {
 public:
  explicit DBusListener(std::unique_ptr<ListenerCore> core) : core_(std::move(core)) {}
  ~DBusListener() override { core_->stop(); }
  const std::string& serviceName() const override { return core_->serviceName(); }
  void resume() override { core_->start(); }

 private:
  std::unique_ptr<ListenerCore> core_;
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
        std::make_unique<ListenerCore>(serviceName, messageServiceSocketPath(root_, serviceName),
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
