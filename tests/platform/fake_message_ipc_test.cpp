#include "platform/fake/fake_message_ipc.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>
#include <vector>

namespace kestrel::platform {
namespace {

using namespace std::chrono_literals;

class FakeMessageIPCTest : public ::testing::Test {
 protected:
  void listen(MessageHandler handler) {
    listener_ = ipc_->createListener("com.zorvane.kestreld",
                                     DispatchQueue::createConcurrent("test.listener"),
                                     std::move(handler), nullptr);
    ASSERT_TRUE(listener_);
  }

  std::shared_ptr<FakeMessageIPC> ipc_ = std::make_shared<FakeMessageIPC>();
  std::shared_ptr<MessageListener> listener_;
};

TEST_F(FakeMessageIPCTest, DeliversWithTheGivenIdentityAndRecordsReplies) {
  std::vector<bool> contexts;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    EXPECT_EQ(connection->pid(), 77);
    EXPECT_EQ(connection->effectiveUserId(), 501u);
    contexts.push_back(message.hasReplyContext());
    if (auto reply = message.makeReply()) {
      reply->setUint64("Seq", message.dictionary().uint64("Seq"));
      EXPECT_TRUE(connection->sendReply(message, *reply));
      EXPECT_FALSE(connection->sendReply(message, *reply));  // answered already
    } else {
      EXPECT_FALSE(connection->sendReply(message, MessageDictionary()));
    }
  });
  PeerCredentials peer;
  peer.pid = 77;
  peer.uid = 501;
  auto connection = ipc_->connect(peer);
  MessageDictionary message;
  message.setUint64("Seq", 1);
  EXPECT_FALSE(connection->deliver(message));  // not resumed yet
  listener_->resume();
  EXPECT_TRUE(connection->deliver(message));
  EXPECT_TRUE(connection->deliver(message, /*expectReply=*/false));
  message.setUint64("Seq", 2);
  EXPECT_TRUE(connection->deliver(message));

  EXPECT_EQ(contexts, (std::vector<bool>{true, false, true}));
  const auto replies = connection->replies();
  ASSERT_EQ(replies.size(), 2u);
  EXPECT_EQ(replies[0].uint64("Seq"), 1u);
  EXPECT_EQ(replies[1].uint64("Seq"), 2u);
  EXPECT_EQ(connection->unansweredRequests(), 0u);
}

TEST_F(FakeMessageIPCTest, DeferredRepliesAndCancellation) {
  std::vector<std::thread> later;
  std::vector<ReceivedMessage> dropped;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    if (message.dictionary().boolean("Cancel")) {
      connection->cancel();
    } else if (message.dictionary().boolean("Keep")) {
      dropped.push_back(message);  // neither answered nor let go yet
    } else {
      later.emplace_back([connection, message] {
        std::this_thread::sleep_for(10ms);
        connection->sendReply(message, *message.makeReply());
      });
    }
  });
  listener_->resume();
  auto connection = ipc_->connect(PeerCredentials{});
  ASSERT_TRUE(connection->deliver(MessageDictionary()));
  EXPECT_TRUE(connection->waitForReplies(1, 5s));

  MessageDictionary keep;
  keep.setBoolean("Keep", true);
  ASSERT_TRUE(connection->deliver(keep));
  EXPECT_EQ(connection->unansweredRequests(), 1u);
  dropped.clear();
  EXPECT_EQ(connection->unansweredRequests(), 0u);

  MessageDictionary cancel;
  cancel.setBoolean("Cancel", true);
  ASSERT_TRUE(connection->deliver(cancel));
  EXPECT_TRUE(connection->cancelled());
  EXPECT_FALSE(connection->deliver(MessageDictionary()));
  EXPECT_EQ(connection->replies().size(), 1u);
  for (auto& thread : later) thread.join();
}

}  // namespace
}  // namespace kestrel::platform
