#include "platform/fake/fake_message_ipc.h"

#include <algorithm>
#include <atomic>

namespace kestrel::platform {

class FakeReplyContext final : public MessageReplyContext {
 public:
  FakeReplyContext(std::weak_ptr<FakeMessageConnection> connection, std::uint64_t requestId)
      : connection_(std::move(connection)), requestId_(requestId) {}
  ~FakeReplyContext() override {
    if (answered_.load()) return;
    if (auto connection = connection_.lock()) connection->forget(requestId_);
  }

  bool belongsTo(const FakeMessageConnection* connection) const {
    return connection_.lock().get() == connection;
  }
  std::uint64_t requestId() const { return requestId_; }
  bool claim() { return !answered_.exchange(true); }

 private:
  std::weak_ptr<FakeMessageConnection> connection_;
  std::uint64_t requestId_;
  std::atomic<bool> answered_{false};
};

class FakeMessageListener final : public MessageListener {
 public:
  FakeMessageListener(std::weak_ptr<FakeMessageIPC> ipc, std::string serviceName)
      : ipc_(std::move(ipc)), serviceName_(std::move(serviceName)) {}
  ~FakeMessageListener() override {
    if (auto ipc = ipc_.lock()) {
      std::lock_guard lock(ipc->mutex_);
      ipc->resumed_ = false;
      ipc->handler_ = nullptr;
      ipc->queue_ = nullptr;
    }
  }
  const std::string& serviceName() const override { return serviceName_; }
  void resume() override {
    if (auto ipc = ipc_.lock()) {
      std::lock_guard lock(ipc->mutex_);
      ipc->resumed_ = true;
    }
  }

 private:
  std::weak_ptr<FakeMessageIPC> ipc_;
  std::string serviceName_;
};

// ---------------------------------------------------------------------------

FakeMessageConnection::FakeMessageConnection(std::weak_ptr<FakeMessageIPC> ipc,
                                             PeerCredentials peer)
    : ipc_(std::move(ipc)), peer_(std::move(peer)) {}

void FakeMessageConnection::cancel() {
  std::lock_guard lock(mutex_);
  cancelled_ = true;
  unanswered_.clear();
  changed_.notify_all();
}

bool FakeMessageConnection::sendReply(const ReceivedMessage& request, MessageDictionary reply) {
  auto* context = dynamic_cast<FakeReplyContext*>(request.replyContext().get());
  if (context == nullptr || !context->belongsTo(this)) return false;
  std::lock_guard lock(mutex_);
  if (cancelled_ || !context->claim()) return false;
  std::erase(unanswered_, context->requestId());
  replies_.push_back(std::move(reply));
  changed_.notify_all();
  return true;
}

void FakeMessageConnection::forget(std::uint64_t requestId) {
  std::lock_guard lock(mutex_);
  std::erase(unanswered_, requestId);
}

bool FakeMessageConnection::deliver(MessageDictionary message, bool expectReply) {
  auto ipc = ipc_.lock();
  if (!ipc) return false;
  auto target = ipc->target();
  if (!target) return false;
  std::shared_ptr<MessageReplyContext> context;
  std::shared_ptr<DispatchQueue> queue;
  {
    std::lock_guard lock(mutex_);
    if (cancelled_) return false;
    if (!queue_) {
      // Like a real connection: its messages in order, on the listener's queue.
      queue_ = DispatchQueue::createSerial("fake.connection");
      if (!queue_) return false;
      queue_->setTarget(target->queue);
    }
    queue = queue_;
    if (expectReply) {
      const std::uint64_t requestId = nextRequestId_++;
      unanswered_.push_back(requestId);
      context = std::make_shared<FakeReplyContext>(weak_from_this(), requestId);
    }
  }
  ReceivedMessage received(std::move(message), std::move(context), shared_from_this());
  queue->sync([&] { (*target->handler)(shared_from_this(), std::move(received)); });
  return true;
}

std::vector<MessageDictionary> FakeMessageConnection::replies() const {
  std::lock_guard lock(mutex_);
  return replies_;
}

std::optional<MessageDictionary> FakeMessageConnection::lastReply() const {
  std::lock_guard lock(mutex_);
  if (replies_.empty()) return std::nullopt;
  return replies_.back();
}

bool FakeMessageConnection::waitForReplies(std::size_t count,
                                           std::chrono::milliseconds timeout) const {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return replies_.size() >= count; });
}

bool FakeMessageConnection::cancelled() const {
  std::lock_guard lock(mutex_);
  return cancelled_;
}

std::size_t FakeMessageConnection::unansweredRequests() const {
  std::lock_guard lock(mutex_);
  return unanswered_.size();
}

// ---------------------------------------------------------------------------

std::shared_ptr<MessageListener> FakeMessageIPC::createListener(
    const std::string& serviceName, std::shared_ptr<DispatchQueue> queue, MessageHandler handler,
    std::string* errorText) {
  std::lock_guard lock(mutex_);
  if (listenerFails_ || !queue || !handler) {
    if (errorText != nullptr) *errorText = "another listener serves " + serviceName;
    return nullptr;
  }
  serviceNames_.push_back(serviceName);
  queue_ = std::move(queue);
  handler_ = std::make_shared<const MessageHandler>(std::move(handler));
  resumed_ = false;
  return std::make_shared<FakeMessageListener>(weak_from_this(), serviceName);
}

void FakeMessageIPC::setListenerFails(bool fails) {
  std::lock_guard lock(mutex_);
  listenerFails_ = fails;
}

std::vector<std::string> FakeMessageIPC::serviceNames() const {
  std::lock_guard lock(mutex_);
  return serviceNames_;
}

bool FakeMessageIPC::listenerResumed() const {
  std::lock_guard lock(mutex_);
  return resumed_;
}

std::shared_ptr<FakeMessageConnection> FakeMessageIPC::connect(PeerCredentials peer) {
  return std::make_shared<FakeMessageConnection>(weak_from_this(), std::move(peer));
}

std::optional<FakeMessageIPC::Target> FakeMessageIPC::target() const {
  std::lock_guard lock(mutex_);
  if (!resumed_ || !queue_ || !handler_) return std::nullopt;
  return Target{queue_, handler_};
}

}  // namespace kestrel::platform
