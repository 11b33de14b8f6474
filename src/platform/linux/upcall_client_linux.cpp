#include "platform/linux/upcall_client_linux.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

namespace kestrel::platform {

namespace {

// The largest reply read; replies are a fixed part and a few paths.
constexpr std::size_t kMaxReplySize = std::size_t{1024} * 1024;

// 0, or the errno of the failure.
int sendDatagram(int fd, std::span<const std::uint8_t> request) {
  for (;;) {
    if (::send(fd, request.data(), request.size(), MSG_NOSIGNAL) >= 0) return 0;
    if (errno != EINTR) return errno;
  }
}

// What a failed send means to the caller.
UpcallClient::Outcome sendFailure(int failure) {
  UpcallClient::Outcome outcome;
  if (failure == EPIPE || failure == ECONNRESET) {
    outcome.status = UpcallClient::Status::Closed;
    outcome.message = "the service closed the connection";
  } else {
    outcome.message = std::string("send: ") + std::strerror(failure);
  }
  return outcome;
}

}  // namespace

std::string upcallSocketPath(const FilesystemRoot& root, const std::string& serviceName) {
  return root.resolve("/run/kestrel") + "/" + serviceName;
}

std::optional<UpcallClient> UpcallClient::connect(const std::string& socketPath,
                                                  std::string* error) {
  auto fail = [&](const std::string& what) -> std::optional<UpcallClient> {
    if (error != nullptr) *error = what;
    return std::nullopt;
  };
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof address.sun_path) return fail("socket path too long");
  std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
  UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  if (!fd) return fail(std::string("socket: ") + std::strerror(errno));
  if (::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    return fail(socketPath + ": " + std::strerror(errno));
  }
  return UpcallClient(std::move(fd));
}

bool UpcallClient::send(std::span<const std::uint8_t> request, std::string* error) {
  const int failure = sendDatagram(fd_.get(), request);
  if (failure != 0 && error != nullptr) *error = sendFailure(failure).message;
  return failure == 0;
}

UpcallClient::Outcome UpcallClient::receive(std::chrono::milliseconds timeout) {
  Outcome outcome;
  if (timeout.count() > 0) {
    pollfd readable{fd_.get(), POLLIN, 0};
    int ready = 0;
    do {
      ready = ::poll(&readable, 1, static_cast<int>(timeout.count()));
    } while (ready < 0 && errno == EINTR);
    if (ready == 0) {
      outcome.status = Status::TimedOut;
      outcome.message = "no reply within " + std::to_string(timeout.count()) + " ms";
      return outcome;
    }
  }
  // Left uninitialised: zero-filling it would touch every page of it, where
  // a reply fills one.
  if (!buffer_) buffer_ = std::make_unique_for_overwrite<std::uint8_t[]>(kMaxReplySize);
  ssize_t size = 0;
  do {
    size = ::recv(fd_.get(), buffer_.get(), kMaxReplySize, MSG_TRUNC);
  } while (size < 0 && errno == EINTR);
  if (size < 0 && errno != ECONNRESET) {
    outcome.message = std::string("recv: ") + std::strerror(errno);
    return outcome;
  }
  if (size <= 0) {
    outcome.status = Status::Closed;
    outcome.message = "the service closed the connection without a reply";
    return outcome;
  }
  if (static_cast<std::size_t>(size) > kMaxReplySize) {
    outcome.message = "a reply of " + std::to_string(size) + " bytes is too large";
    return outcome;
  }
  outcome.status = Status::Reply;
  outcome.reply.assign(buffer_.get(), buffer_.get() + size);
  return outcome;
}

UpcallClient::Outcome UpcallClient::call(std::span<const std::uint8_t> request,
                                         std::chrono::milliseconds timeout) {
  if (const int failure = sendDatagram(fd_.get(), request); failure != 0) {
    return sendFailure(failure);
  }
  return receive(timeout);
}

}  // namespace kestrel::platform
