// The upcall channel on Linux: a SOCK_SEQPACKET socket named after the service
// in <root>/run/kestrel. One datagram is one request; the reply goes back on the
// same connection. The sender's credentials come from SO_PEERCRED.
#include "platform/linux/upcall_channel_linux.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <mutex>

#include "platform/unique_fd.h"

namespace kestrel::platform {

namespace {

// Requests are a fixed header and a packed buffer of paths; anything larger is
// not a request of ours and closes the connection.
constexpr std::size_t kMaxRequestSize = 4 * 1024 * 1024;

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

// Receives on the listening socket and on every accepted connection. All
// handlers run on the one queue given, so the connection table is touched only
// there (and by the destructor, after the listener source is gone).
class UpcallReceiveSource final : public ReadSource {
 public:
  UpcallReceiveSource(std::shared_ptr<LinuxUpcallPort> port, std::shared_ptr<DispatchQueue> queue,
                      UpcallHandler handler)
      : port_(std::move(port)), queue_(std::move(queue)), handler_(std::move(handler)) {}

  bool start() {
    listener_ = ReadSource::create(port_->fd(), queue_, [this] { acceptPending(); });
    return listener_ != nullptr;
  }

  ~UpcallReceiveSource() override {
    listener_.reset();
    std::lock_guard lock(mutex_);
    connections_.clear();
  }

  void resume() override { listener_->resume(); }

 private:
  struct Connection {
    UniqueFd fd;
    std::unique_ptr<ReadSource> source;
  };

  void acceptPending() {
    for (;;) {
      const int fd = ::accept4(port_->fd(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (fd < 0) return;  // EAGAIN, or a connection that went away already
      auto connection = std::make_unique<Connection>();
      connection->fd.reset(fd);
      connection->source = ReadSource::create(fd, queue_, [this, fd] { receive(fd); });
      if (!connection->source) continue;
      connection->source->resume();
      std::lock_guard lock(mutex_);
      connections_[fd] = std::move(connection);
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

  void receive(int fd) {
    for (;;) {
      const ssize_t size = ::recv(fd, nullptr, 0, MSG_PEEK | MSG_TRUNC | MSG_DONTWAIT);
      if (size < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;
      if (size <= 0 || static_cast<std::size_t>(size) > kMaxRequestSize) {
        close(fd);
        return;
      }
      std::vector<std::uint8_t> request(static_cast<std::size_t>(size));
      if (::recv(fd, request.data(), request.size(), MSG_DONTWAIT) != size) {
        close(fd);
        return;
      }
      struct ucred cred = {};
      socklen_t len = sizeof cred;
      if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        close(fd);
        return;
      }
      const UpcallPeer peer{cred.pid, cred.uid, cred.gid};
      std::optional<std::vector<std::uint8_t>> reply = handler_(request, peer);
      if (reply && ::send(fd, reply->data(), reply->size(), MSG_NOSIGNAL) < 0) {
        close(fd);
        return;
      }
    }
  }

  std::shared_ptr<LinuxUpcallPort> port_;
  std::shared_ptr<DispatchQueue> queue_;
  UpcallHandler handler_;
  std::unique_ptr<ReadSource> listener_;
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
    const std::string directory = root_.resolve("/run/kestrel");
    std::error_code ec;
    std::filesystem::create_directories(directory, ec);
    if (ec) return fail("cannot make " + directory, ec.value());
    const std::string path = directory + "/" + serviceName;

    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
      return fail("socket path too long: " + path, ENAMETOOLONG);
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);

    UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!fd) return fail("socket", errno);
    ::unlink(path.c_str());  // a socket left by an earlier run of the daemon
    if (::bind(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
      return fail("bind " + path, errno);
    }
    ::chmod(path.c_str(), 0600);
    if (::listen(fd.get(), SOMAXCONN) != 0) return fail("listen " + path, errno);
    return std::make_shared<LinuxUpcallPort>(serviceName, path, std::move(fd));
  }

  std::unique_ptr<ReadSource> createReceiveSource(std::shared_ptr<UpcallPort> port,
                                                  std::shared_ptr<DispatchQueue> queue,
                                                  UpcallHandler handler) override {
    auto linuxPort = std::dynamic_pointer_cast<LinuxUpcallPort>(port);
    if (!linuxPort || !queue || !handler) return nullptr;
    auto source = std::make_unique<UpcallReceiveSource>(std::move(linuxPort), std::move(queue),
                                                        std::move(handler));
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
