// The upcall channel on Linux: a SOCK_SEQPACKET socket named after the service
// in <root>/run/kestrel, mode 0600 and owned by root. One datagram is one
// message; the reply goes back on the same connection. The sender's
// credentials are read once, at accept (SO_PEERCRED), and every message of the
// connection gets its trailer from them.
#include "platform/linux/upcall_channel_linux.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <mutex>

#include "platform/linux/upcall_client_linux.h"
#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// Requests are a fixed part and a packed buffer of identifiers; a datagram
// larger than this is no request of ours and closes its connection.
constexpr std::size_t kMaxDatagramSize = std::size_t{1024} * 1024;
// How long a reply may wait for room in a peer that does not read its
// replies. The main queue waits that long at most, then drops the peer.
constexpr std::chrono::milliseconds kSendTimeout(250);

class LinuxUpcallPort final : public UpcallPort {
 public:
  LinuxUpcallPort(std::string name, std::string path, UniqueFd fd)
      : name_(std::move(name)), path_(std::move(path)), fd_(std::move(fd)) {}
  ~LinuxUpcallPort() override { ::unlink(path_.c_str()); }
  const std::string& serviceName() const override { return name_; }
  int fd() const { return fd_.get(); }

 private:
  std::string name_;
  std::string path_;
  UniqueFd fd_;
};

std::string describe(const UpcallPeer& peer) {
  return "pid " + std::to_string(peer.pid) + " (uid " + std::to_string(peer.uid) + ")";
}

// Receives on the listening socket and on every accepted connection. All
// handlers run on the one queue given, so the connection table is touched only
// there (and by the destructor, after the listener source is gone).
class UpcallReceiveSource final : public ReadSource {
 public:
  UpcallReceiveSource(std::shared_ptr<LinuxUpcallPort> port, std::shared_ptr<DispatchQueue> queue,
                      std::size_t maxMessageSize, UpcallHandler handler,
                      UpcallProblemHandler problems)
      : port_(std::move(port)),
        queue_(std::move(queue)),
        maxMessageSize_(maxMessageSize),
        handler_(std::move(handler)),
        problems_(std::move(problems)) {}

  bool start() {
    listener_ = ReadSource::create(port_->fd(), queue_, [this] { acceptPending(); });
    return listener_ != nullptr;
  }

  ~UpcallReceiveSource() override {
    listener_.reset();
    std::map<int, std::unique_ptr<Connection>> gone;
    {
      std::lock_guard lock(mutex_);
      gone.swap(connections_);
    }
    // Each source waits for its running handler, which may want the lock.
    gone.clear();
  }

  void resume() override { listener_->resume(); }

 private:
  struct Connection {
    UniqueFd fd;
    UpcallPeer peer;
    std::unique_ptr<ReadSource> source;
  };

  void report(const std::string& what) {
    if (problems_) problems_(what);
  }

  void acceptPending() {
    for (;;) {
      UniqueFd fd(::accept4(port_->fd(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
      if (!fd) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) {
          report(std::string("cannot accept a connection: ") + std::strerror(errno));
        }
        return;
      }
      struct ucred cred = {};
      socklen_t length = sizeof cred;
      if (::getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0) continue;
      auto connection = std::make_unique<Connection>();
      const int raw = fd.get();
      connection->fd = std::move(fd);
      connection->peer = UpcallPeer{cred.pid, cred.uid, cred.gid};
      connection->source = ReadSource::create(raw, queue_, [this, raw] { receive(raw); });
      if (!connection->source) continue;
      connection->source->resume();
      std::lock_guard lock(mutex_);
      connections_[raw] = std::move(connection);
    }
  }

  void close(int fd) {
    std::unique_ptr<Connection> gone;
    {
      std::lock_guard lock(mutex_);
      auto it = connections_.find(fd);
      if (it == connections_.end()) return;
      gone = std::move(it->second);
      connections_.erase(it);
    }
    // Destroyed outside the lock; this runs inside the source's own handler.
  }

  Connection* connection(int fd) {
    std::lock_guard lock(mutex_);
    auto it = connections_.find(fd);
    return it == connections_.end() ? nullptr : it->second.get();
  }

  // One datagram a call: the source calls again while more are waiting.
  void receive(int fd) {
    Connection* from = connection(fd);
    if (from == nullptr) return;
    if (buffer_.empty()) buffer_.resize(kMaxDatagramSize);
    const ssize_t size = ::recv(fd, buffer_.data(), buffer_.size(), MSG_DONTWAIT | MSG_TRUNC);
    if (size < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) return;
    if (size <= 0) {  // the peer went away (or sent an empty datagram)
      close(fd);
      return;
    }
    if (static_cast<std::size_t>(size) > buffer_.size()) {
      report("a datagram of " + std::to_string(size) + " bytes from " + describe(from->peer) +
             " is larger than any request; connection closed");
      close(fd);
      return;
    }
    std::string problem;
    std::optional<UpcallMessage> message = UpcallMessage::fromDatagram(
        std::vector<std::uint8_t>(buffer_.begin(), buffer_.begin() + size), from->peer,
        maxMessageSize_, ++sequence_, &problem);
    if (!message) {
      report(problem + " (from " + describe(from->peer) + "); connection closed");
      close(fd);
      return;
    }
    const std::optional<std::vector<std::uint8_t>> reply = handler_(*message);
    if (!reply) {
      report("a message from " + describe(from->peer) + " is not served here; connection closed");
      close(fd);
      return;
    }
    if (!send(*from, *reply)) close(fd);
  }

  // Waits kSendTimeout at most for room in the peer's queue.
  bool send(const Connection& to, const std::vector<std::uint8_t>& reply) {
    const auto deadline = std::chrono::steady_clock::now() + kSendTimeout;
    for (;;) {
      if (::send(to.fd.get(), reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0) {
        return true;
      }
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) {
        if (errno != EPIPE && errno != ECONNRESET) {
          report("cannot send a reply of " + std::to_string(reply.size()) + " bytes to " +
                 describe(to.peer) + ": " + std::strerror(errno) + "; connection closed");
        }
        return false;
      }
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) {
        report("a reply to " + describe(to.peer) + " found no room for " +
               std::to_string(kSendTimeout.count()) +
               " ms: the peer does not read its replies; connection closed");
        return false;
      }
      pollfd writable{to.fd.get(), POLLOUT, 0};
      ::poll(&writable, 1, static_cast<int>(left.count()));
    }
  }

  std::shared_ptr<LinuxUpcallPort> port_;
  std::shared_ptr<DispatchQueue> queue_;
  const std::size_t maxMessageSize_;
  UpcallHandler handler_;
  UpcallProblemHandler problems_;
  std::unique_ptr<ReadSource> listener_;
  std::vector<std::uint8_t> buffer_;  // used on the queue only
  std::uint32_t sequence_ = 0;
  std::mutex mutex_;
  std::map<int, std::unique_ptr<Connection>> connections_;
};

class LinuxUpcallChannel final : public UpcallChannel {
 public:
  explicit LinuxUpcallChannel(FilesystemRoot root) : root_(std::move(root)) {}

  std::shared_ptr<UpcallPort> checkIn(const std::string& serviceName,
                                      std::string* errorText) override {
    auto fail = [&](const std::string& what, int err) -> std::shared_ptr<UpcallPort> {
      if (errorText != nullptr) *errorText = what + ": " + std::strerror(err);
      return nullptr;
    };
    const std::string path = upcallSocketPath(root_, serviceName);
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
    if (ec) return fail("cannot make the directory of " + path, ec.value());

    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
      return fail("socket path too long: " + path, ENAMETOOLONG);
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);

    UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!fd) return fail("socket", errno);
    // The socket's own mode becomes the file's at bind: nobody else can
    // connect in the moment before the chmod below.
    if (::fchmod(fd.get(), 0600) != 0) return fail("fchmod", errno);
    ::unlink(path.c_str());  // a socket left by an earlier run of the daemon
    if (::bind(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
      return fail("bind " + path, errno);
    }
    if (::lchown(path.c_str(), 0, 0) != 0) return fail("chown " + path, errno);
    if (::chmod(path.c_str(), 0600) != 0) return fail("chmod " + path, errno);
    if (::listen(fd.get(), SOMAXCONN) != 0) return fail("listen " + path, errno);
    return std::make_shared<LinuxUpcallPort>(serviceName, path, std::move(fd));
  }

  std::unique_ptr<ReadSource> createReceiveSource(std::shared_ptr<UpcallPort> port,
                                                  std::shared_ptr<DispatchQueue> queue,
                                                  std::size_t maxMessageSize, UpcallHandler handler,
                                                  UpcallProblemHandler problems) override {
    auto linuxPort = std::dynamic_pointer_cast<LinuxUpcallPort>(port);
    if (!linuxPort || !queue || !handler) return nullptr;
    auto source = std::make_unique<UpcallReceiveSource>(std::move(linuxPort), std::move(queue),
                                                        maxMessageSize, std::move(handler),
                                                        std::move(problems));
    if (!source->start()) return nullptr;
    return source;
  }

 private:
  FilesystemRoot root_;
};

}  // namespace

std::shared_ptr<UpcallChannel> makeLinuxUpcallChannel(const FilesystemRoot& root) {
  return std::make_shared<LinuxUpcallChannel>(root);
}

}  // namespace kestrel::platform
