// Message IPC for tests: a listener that records how it was made, and fake
// connections with chosen credentials that deliver messages to its handler and
// record the replies and the cancellation.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/message_ipc.h"

namespace kestrel::platform {

class FakeMessageIPC;

class FakeMessageConnection final : public MessageConnection,
                                    public std::enable_shared_from_this<FakeMessageConnection> {
 public:
  FakeMessageConnection(std::weak_ptr<FakeMessageIPC> ipc, PeerCredentials peer);

  const PeerCredentials& peerCredentials() const override { return peer_; }
  void cancel() override;
  bool sendReply(const ReceivedMessage& request, MessageDictionary reply) override;

  // Hands the message to the listener's handler on the listener's queue and
  // returns once the handler has returned. False (nothing delivered) when
  // there is no resumed listener or the connection was cancelled.
  bool deliver(MessageDictionary message, bool expectReply = true);

  // Replies in the order they were sent.
  std::vector<MessageDictionary> replies() const;
  // The last reply, if any.
  std::optional<MessageDictionary> lastReply() const;
  // Waits until at least `count` replies were sent (for replies sent later,
  // from another thread). False on timeout.
  bool waitForReplies(std::size_t count, std::chrono::milliseconds timeout) const;
  bool cancelled() const;
  // Requests delivered with a reply context and neither answered yet nor let go.
  std::size_t unansweredRequests() const;

 private:
  friend class FakeReplyContext;
  void forget(std::uint64_t requestId);

  std::weak_ptr<FakeMessageIPC> ipc_;
  const PeerCredentials peer_;
  std::shared_ptr<DispatchQueue> queue_;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<MessageDictionary> replies_;
  std::vector<std::uint64_t> unanswered_;
  std::uint64_t nextRequestId_ = 1;
  bool cancelled_ = false;
};

class FakeMessageIPC final : public MessageIPC,
                             public std::enable_shared_from_this<FakeMessageIPC> {
 public:
  std::shared_ptr<MessageListener> createListener(const std::string& serviceName,
                                                  std::shared_ptr<DispatchQueue> queue,
                                                  MessageHandler handler,
                                                  std::string* errorText) override;

  void setListenerFails(bool fails);
  // Names of the services listeners were made for.
  std::vector<std::string> serviceNames() const;
  bool listenerResumed() const;

  // A new peer with the given identity; needs the fake to be owned by a shared_ptr.
  std::shared_ptr<FakeMessageConnection> connect(PeerCredentials peer);

 private:
  friend class FakeMessageConnection;
  friend class FakeMessageListener;
  struct Target {
    std::shared_ptr<DispatchQueue> queue;
    std::shared_ptr<const MessageHandler> handler;
  };
  // The resumed listener's queue and handler; nothing before resume().
  std::optional<Target> target() const;

  mutable std::mutex mutex_;
  bool listenerFails_ = false;
  bool resumed_ = false;
  std::vector<std::string> serviceNames_;
  std::shared_ptr<DispatchQueue> queue_;
  std::shared_ptr<const MessageHandler> handler_;
};

}  // namespace kestrel::platform
