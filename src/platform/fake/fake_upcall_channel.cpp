#include "platform/fake/fake_upcall_channel.h"

namespace kestrel::platform {

namespace {
class FakeUpcallPort final : public UpcallPort {
 public:
  explicit FakeUpcallPort(std::string name) : name_(std::move(name)) {}
  const std::string& serviceName() const override { return name_; }

 private:
  std::string name_;
};
}  // namespace

class FakeUpcallSource final : public ReadSource {
 public:
  explicit FakeUpcallSource(FakeUpcallChannel& owner) : owner_(owner) {}
  void resume() override {
    std::lock_guard lock(owner_.mutex_);
    owner_.sourceResumed_ = true;
  }

 private:
  FakeUpcallChannel& owner_;
};

std::shared_ptr<UpcallPort> FakeUpcallChannel::checkIn(const std::string& serviceName,
                                                       std::string* errorText) {
  std::lock_guard lock(mutex_);
  if (checkInFails_) {
    if (errorText != nullptr) *errorText = "(ipc/send) invalid destination port";
    return nullptr;
  }
  checkedIn_.push_back(serviceName);
  return std::make_shared<FakeUpcallPort>(serviceName);
}

std::unique_ptr<ReadSource> FakeUpcallChannel::createReceiveSource(
    std::shared_ptr<UpcallPort> /*port*/, std::shared_ptr<DispatchQueue> /*queue*/,
    std::size_t maxMessageSize, UpcallHandler handler, UpcallProblemHandler /*problems*/) {
  std::lock_guard lock(mutex_);
  if (sourceFails_) return nullptr;
  maxMessageSize_ = maxMessageSize;
  handler_ = std::move(handler);
  return std::make_unique<FakeUpcallSource>(*this);
}

void FakeUpcallChannel::setCheckInFails(bool fails) {
  std::lock_guard lock(mutex_);
  checkInFails_ = fails;
}

void FakeUpcallChannel::setSourceFails(bool fails) {
  std::lock_guard lock(mutex_);
  sourceFails_ = fails;
}

std::vector<std::string> FakeUpcallChannel::checkedIn() const {
  std::lock_guard lock(mutex_);
  return checkedIn_;
}

bool FakeUpcallChannel::sourceResumed() const {
  std::lock_guard lock(mutex_);
  return sourceResumed_;
}

std::optional<std::vector<std::uint8_t>> FakeUpcallChannel::deliver(
    std::vector<std::uint8_t> datagram, const UpcallPeer& peer) {
  UpcallHandler handler;
  std::optional<UpcallMessage> message;
  {
    std::lock_guard lock(mutex_);
    handler = handler_;
    message = UpcallMessage::fromDatagram(std::move(datagram), peer, maxMessageSize_, ++sequence_,
                                          nullptr);
  }
  if (!handler || !message) return std::nullopt;
  return handler(*message);
}

}  // namespace kestrel::platform
