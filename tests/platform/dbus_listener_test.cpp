#include "platform/linux/dbus_listener.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <optional>
#include <semaphore>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/dbus_message_codec.h"
#include "platform/unique_fd.h"
#include "support/daemon_process.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using namespace std::chrono_literals;

constexpr const char* kService = "com.zorvane.kestreld";
constexpr const char* kObject = "/com/zorvane/kestreld";
// Only a guard against a hang: every wait normally ends long before it.
constexpr auto kTimeout =
    30s;  // generous: only a failing test waits this long, and CI runs under ASan
constexpr std::uint64_t kCallTimeoutUsec = 5'000'000;

struct BusUnref {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct MessageUnref {
  void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using BusPtr = std::unique_ptr<sd_bus, BusUnref>;
using MessagePtr = std::unique_ptr<sd_bus_message, MessageUnref>;

struct CallResult {
  int status = 0;  // negative errno when the call failed
  std::string errorName;
  MessageDictionary reply;
};

// A direct sd-bus client of the listener.
class Client {
 public:
  explicit Client(const std::string& address, bool busClient = false) {
    sd_bus* raw = nullptr;
    EXPECT_GE(sd_bus_new(&raw), 0);
    bus_.reset(raw);
    EXPECT_GE(sd_bus_set_address(raw, address.c_str()), 0);
    EXPECT_GE(sd_bus_set_bus_client(raw, busClient ? 1 : 0), 0);
    startStatus_ = sd_bus_start(raw);
  }

  sd_bus* bus() const { return bus_.get(); }
  int startStatus() const { return startStatus_; }

  MessagePtr newCall(const char* member = "Request", const char* interface = kService) {
    sd_bus_message* m = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus(), &m, kService, kObject, interface, member), 0);
    return MessagePtr(m);
  }

  MessagePtr newRequest(const MessageDictionary& request) {
    MessagePtr m = newCall();
    EXPECT_GE(dbus::appendDictionary(m.get(), request), 0);
    return m;
  }

  CallResult send(sd_bus_message* m) {
    CallResult result;
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    result.status = sd_bus_call(bus(), m, kCallTimeoutUsec, &error, &reply);
    MessagePtr owned(reply);
    if (error.name != nullptr) result.errorName = error.name;
    sd_bus_error_free(&error);
    if (result.status >= 0) {
      EXPECT_GE(dbus::readDictionary(reply, &result.reply), 0);
    }
    return result;
  }

  CallResult call(const MessageDictionary& request) { return send(newRequest(request).get()); }

 private:
  BusPtr bus_;
  int startStatus_ = 0;
};

// The string a method answers with (called with no argument or one string).
std::string stringReply(sd_bus* bus, const char* service, const char* object, const char* interface,
                        const char* member, const char* argument = nullptr) {
  sd_bus_message* raw = nullptr;
  const int r = argument != nullptr ? sd_bus_call_method(bus, service, object, interface, member,
                                                         nullptr, &raw, "s", argument)
                                    : sd_bus_call_method(bus, service, object, interface, member,
                                                         nullptr, &raw, "");
  MessagePtr reply(raw);
  const char* text = nullptr;
  if (r < 0 || sd_bus_message_read(raw, "s", &text) < 0) return "(failed)";
  return text;
}

MessageDictionary withSeq(std::uint64_t seq) {
  MessageDictionary d;
  d.setUint64("Seq", seq);
  return d;
}

// A one-shot flag that threads can wait on (each waits once).
struct Signal : std::binary_semaphore {
  Signal() : std::binary_semaphore(0) {}
  void set() { release(); }
  bool wait() { return try_acquire_for(kTimeout); }
};

class DBusListenerTest : public ::testing::Test {
 protected:
  void listen(MessageHandler handler) {
    ipc_ = makeLinuxMessageIPC(scratch_.root());
    std::string error;
    listener_ = ipc_->createListener(kService, queue_, std::move(handler), &error);
    ASSERT_TRUE(listener_) << error;
    listener_->resume();
  }

  // Replies with the request's own keys.
  void listenEcho() {
    listen([](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
      auto reply = message.makeReply();
      if (!reply) return;
      for (const auto& [key, value] : message.dictionary().entries()) reply->set(key, value);
      connection->sendReply(message, std::move(*reply));
    });
  }

  std::string socketPath() const { return messageServiceSocketPath(scratch_.root(), kService); }
  std::string address() const { return "unix:path=" + socketPath(); }

  testing::ScratchRoot scratch_;
  std::shared_ptr<DispatchQueue> queue_ = DispatchQueue::createConcurrent("test.listener");
  std::shared_ptr<MessageIPC> ipc_;
  std::shared_ptr<MessageListener> listener_;
};

TEST_F(DBusListenerTest, SocketIsOpenToEveryoneAndReplacesAStaleOne) {
  const std::string path = messageServiceSocketPath(scratch_.root(), kService);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  scratch_.writeFile("/run/kestrel/com.zorvane.kestreld", "stale");
  listenEcho();
  struct stat st = {};
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0666u);
  ASSERT_EQ(::stat(std::filesystem::path(path).parent_path().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0755u);

  // A second listener does not take the name from a live one.
  std::string error;
  auto second = ipc_->createListener(
      kService, queue_, [](auto, auto) {}, &error);
  EXPECT_FALSE(second);
  EXPECT_NE(error.find("another listener"), std::string::npos) << error;

  listener_.reset();
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(DBusListenerTest, EveryWireTypeRoundTripsAndOthersReadAsAbsent) {
  listenEcho();
  MessageDictionary request;
  request.setUint64("Command", UINT64_MAX);
  request.setInt64("Signed", INT64_MIN);
  request.setBoolean("Flag", true);
  request.setString("Text", "gr\xC3\xBC\xC3\x9F dich");
  request.setUuid("UUID", Uuid::random());
  request.setData("Empty", {});
  request.setData("Bytes", {0, 1, 255});
  request.setReal("Real", -0.5);
  request.setArray("Array", {MessageValue::fromUint64(1), MessageValue::fromString("two"),
                             MessageValue::fromArray({})});
  MessageDictionary inner;
  inner.setDictionary("Empty", {});
  inner.setArray("Deep", {MessageValue::fromDictionary(withSeq(3))});
  request.setDictionary("Dictionary", inner);

  Client client(address());
  ASSERT_GE(client.startStatus(), 0);
  const CallResult result = client.call(request);
  ASSERT_GE(result.status, 0) << result.errorName;
  EXPECT_EQ(result.reply, request);
  EXPECT_EQ(result.reply.uuid("UUID"), request.uuid("UUID"));

  // Values outside the model read as absent.
  MessagePtr m = client.newCall();
  // "Small": a uint32 is not a uint64; "Mixed": an array with such an element;
  // "Nested": a dictionary keeps its good entries only.
  ASSERT_GE(sd_bus_message_append(m.get(), "a{sv}", 4, "Small", "u", 5u, "Good", "t",
                                  std::uint64_t{6}, "Mixed", "av", 2, "t", std::uint64_t{1}, "u",
                                  2u, "Nested", "a{sv}", 2, "Bad", "i", -1, "Fine", "b", 1),
            0);
  const CallResult odd = client.send(m.get());
  ASSERT_GE(odd.status, 0) << odd.errorName;
  EXPECT_FALSE(odd.reply.contains("Small"));
  EXPECT_FALSE(odd.reply.contains("Mixed"));
  EXPECT_EQ(odd.reply.uint64("Good"), 6u);
  ASSERT_NE(odd.reply.dictionary("Nested"), nullptr);
  EXPECT_EQ(odd.reply.dictionary("Nested")->size(), 1u);
  EXPECT_TRUE(odd.reply.dictionary("Nested")->boolean("Fine"));
}

TEST_F(DBusListenerTest, EntriesBeyondTheSizeBudgetReadAsAbsent) {
  listen([](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    // Report what arrived, not the bulk itself.
    auto reply = *message.makeReply();
    for (const auto& [key, value] : message.dictionary().entries()) {
      reply.setUint64(key, value.data() ? value.data()->size() : 0);
    }
    connection->sendReply(message, std::move(reply));
  });
  Client client(address());
  MessageDictionary request;
  // Entries are read in key order: A fits, B would pass the budget, C fits
  // beside A again.
  request.setData("A", MessageData(9 * 1024 * 1024));
  request.setData("B", MessageData(9 * 1024 * 1024));
  request.setData("C", MessageData(1024));
  const CallResult result = client.call(request);
  ASSERT_GE(result.status, 0) << result.errorName;
  EXPECT_EQ(result.reply.uint64("A"), 9u * 1024 * 1024);
  EXPECT_FALSE(result.reply.contains("B"));
  EXPECT_EQ(result.reply.uint64("C"), 1024u);
}

TEST_F(DBusListenerTest, BusClientsGetAHelloAndIntrospection) {
  listenEcho();
  Client client(address(), /*busClient=*/true);
  ASSERT_GE(client.startStatus(), 0);
  const char* unique = nullptr;
  ASSERT_GE(sd_bus_get_unique_name(client.bus(), &unique), 0);
  EXPECT_EQ(std::string(unique).rfind(":1.", 0), 0u) << unique;
  EXPECT_EQ(client.call(withSeq(9)).reply.uint64("Seq"), 9u);

  const std::string xml = stringReply(client.bus(), kService, kObject,
                                      "org.freedesktop.DBus.Introspectable", "Introspect");
  EXPECT_NE(xml.find("<interface name=\"com.zorvane.kestreld\">"), std::string::npos) << xml;
  EXPECT_NE(xml.find("<method name=\"Request\">"), std::string::npos) << xml;
  // Clients that resolve the service name before they call get an owner.
  EXPECT_EQ(stringReply(client.bus(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                        "org.freedesktop.DBus", "GetNameOwner", kService)
                .substr(0, 1),
            ":");
}

TEST_F(DBusListenerTest, BadCallsGetStandardErrorsAndTheConnectionGoesOn) {
  listenEcho();
  Client client(address());
  struct Row {
    const char* what;
    const char* interface;
    const char* member;
    bool stringArgument;
    const char* expectedError;
  };
  const Row rows[] = {
      {"wrong signature", kService, "Request", true, SD_BUS_ERROR_INVALID_ARGS},
      {"no arguments", kService, "Request", false, SD_BUS_ERROR_INVALID_ARGS},
      {"unknown method", kService, "Nope", false, SD_BUS_ERROR_UNKNOWN_METHOD},
      {"unknown interface", "com.zorvane.other", "Request", false, SD_BUS_ERROR_UNKNOWN_METHOD},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    MessagePtr m = client.newCall(row.member, row.interface);
    if (row.stringArgument) {
      ASSERT_GE(sd_bus_message_append(m.get(), "s", "x"), 0);
    }
    const CallResult result = client.send(m.get());
    EXPECT_LT(result.status, 0);
    EXPECT_EQ(result.errorName, row.expectedError);
    EXPECT_EQ(client.call(withSeq(1)).reply.uint64("Seq"), 1u);
  }
}

TEST_F(DBusListenerTest, GarbageInsteadOfAHandshakeClosesOnlyThatConnection) {
  listenEcho();
  const std::string path = socketPath();
  for (const std::string& garbage :
       {std::string("\0GET / HTTP/1.0\r\n\r\n", 20), std::string("\0AUTH ANONYMOUS\r\n", 18),
        std::string(4096, '\xff')}) {
    SCOPED_TRACE(garbage.substr(1, 10));
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un name = {};
    name.sun_family = AF_UNIX;
    std::memcpy(name.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(::connect(fd.get(), reinterpret_cast<sockaddr*>(&name), sizeof name), 0);
    ASSERT_EQ(::send(fd.get(), garbage.data(), garbage.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(garbage.size()));
    // The listener answers with an error line or hangs up; it never serves it.
    struct timeval timeout = {5, 0};
    ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    char buffer[256];
    const ssize_t n = ::recv(fd.get(), buffer, sizeof buffer, 0);
    if (n > 0) {
      const std::string answer(buffer, static_cast<std::size_t>(n));
      EXPECT_TRUE(answer.rfind("REJECTED", 0) == 0 || answer.rfind("ERROR", 0) == 0) << answer;
    }
    EXPECT_EQ(Client(address()).call(withSeq(2)).reply.uint64("Seq"), 2u);
  }
}

TEST_F(DBusListenerTest, PeerThatDoesNotReadItsRepliesIsClosed) {
  listen([](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    auto reply = *message.makeReply();
    reply.setData("Bulk", MessageData(32 * 1024));
    reply.setUint64("Seq", message.dictionary().uint64("Seq"));
    connection->sendReply(message, std::move(reply));
  });
  Client greedy(address());
  // Small requests, large replies never read: more than the socket buffer
  // (sd-bus asks for 8 MiB) and the listener's queue of unread replies hold.
  for (int i = 0; i < 3000; ++i) {
    MessagePtr m = greedy.newRequest(withSeq(static_cast<std::uint64_t>(i)));
    std::uint64_t cookie = 0;  // without one, sd-bus marks the call as expecting no reply
    ASSERT_GE(sd_bus_send(greedy.bus(), m.get(), &cookie), 0);
  }
  ASSERT_GE(sd_bus_flush(greedy.bus()), 0);
  struct pollfd hangUp = {sd_bus_get_fd(greedy.bus()), POLLRDHUP, 0};
  ASSERT_EQ(::poll(&hangUp, 1, static_cast<int>(std::chrono::milliseconds(kTimeout).count())), 1);
  EXPECT_TRUE(hangUp.revents & (POLLRDHUP | POLLHUP));
  EXPECT_EQ(Client(address()).call(withSeq(3)).reply.uint64("Seq"), 3u);
}

TEST_F(DBusListenerTest, OneWayCallsAndCancelledConnectionsGetNoReply) {
  std::optional<bool> hadContext;
  Signal handled;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    if (message.dictionary().boolean("OneWay")) {
      hadContext = message.hasReplyContext() || message.makeReply().has_value();
      EXPECT_FALSE(connection->sendReply(message, MessageDictionary()));
      handled.set();
    } else if (message.dictionary().boolean("Refuse")) {
      connection->cancel();
    } else {
      connection->sendReply(message, *message.makeReply());
    }
  });
  Client client(address());
  MessageDictionary request;
  request.setBoolean("OneWay", true);
  MessagePtr m = client.newRequest(request);
  ASSERT_GE(sd_bus_message_set_expect_reply(m.get(), 0), 0);
  ASSERT_GE(sd_bus_send(client.bus(), m.get(), nullptr), 0);
  ASSERT_GE(sd_bus_flush(client.bus()), 0);
  ASSERT_TRUE(handled.wait());
  EXPECT_EQ(hadContext, false);
  EXPECT_GE(client.call(MessageDictionary()).status, 0);

  request = MessageDictionary();
  request.setBoolean("Refuse", true);
  const CallResult result = client.call(request);
  EXPECT_TRUE(result.status == -ECONNRESET || result.status == -ENOTCONN ||
              result.errorName == SD_BUS_ERROR_NO_REPLY)
      << result.status << " " << result.errorName;
  EXPECT_GE(Client(address()).call(MessageDictionary()).status, 0);
}

TEST_F(DBusListenerTest, PeerCredentialsAreThoseOfTheClientProcess) {
  std::mutex mutex;
  std::optional<PeerCredentials> seen;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    {
      std::lock_guard lock(mutex);
      seen = connection->peerCredentials();
    }
    connection->sendReply(message, *message.makeReply());
  });
  // busctl, as any D-Bus client would, in a process of its own.
  const testing::ProcessResult busctl = testing::runProcess(
      "/usr/bin/busctl", {"--address=" + address(), "call", kService, kObject, kService, "Request",
                          "a{sv}", "1", "Command", "t", "0"});
  EXPECT_EQ(busctl.exitStatus, 0) << busctl.output;

  std::lock_guard lock(mutex);
  ASSERT_TRUE(seen);
  EXPECT_EQ(seen->pid, busctl.pid);
  EXPECT_EQ(seen->uid, ::geteuid());
  EXPECT_EQ(seen->gid, ::getegid());
  EXPECT_NE(seen->pidfd, nullptr);
  EXPECT_TRUE(seen->executableStatus);
  ASSERT_TRUE(seen->executablePath);
  EXPECT_EQ(std::filesystem::path(*seen->executablePath).filename(), "busctl");
}

// ---------------------------------------------------------------------------
// Threads

class DBusListenerConcurrencyTest : public DBusListenerTest {};

TEST_F(DBusListenerConcurrencyTest, PipelinedRequestsOfOneConnectionAreAnsweredInOrder) {
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    // Uneven delays: a later request often finishes its handler first.
    const std::uint64_t seq = message.dictionary().uint64("Seq");
    std::this_thread::sleep_for(std::chrono::microseconds((seq * 7919) % 2000));
    auto reply = *message.makeReply();
    reply.setUint64("Seq", seq);
    connection->sendReply(message, std::move(reply));
  });

  Client client(address());
  constexpr std::uint64_t kCount = 40;
  std::vector<std::uint64_t> order;
  auto onReply = [](sd_bus_message* m, void* userdata, sd_bus_error*) -> int {
    MessageDictionary reply;
    if (sd_bus_message_is_method_error(m, nullptr) == 0 && dbus::readDictionary(m, &reply) >= 0) {
      static_cast<std::vector<std::uint64_t>*>(userdata)->push_back(reply.uint64("Seq"));
    } else {
      static_cast<std::vector<std::uint64_t>*>(userdata)->push_back(UINT64_MAX);
    }
    return 0;
  };
  for (std::uint64_t i = 0; i < kCount; ++i) {
    MessagePtr m = client.newRequest(withSeq(i));
    ASSERT_GE(sd_bus_call_async(client.bus(), nullptr, m.get(), onReply, &order, kCallTimeoutUsec),
              0);
  }
  const auto deadline = std::chrono::steady_clock::now() + kTimeout;
  while (order.size() < kCount && std::chrono::steady_clock::now() < deadline) {
    if (sd_bus_process(client.bus(), nullptr) == 0) sd_bus_wait(client.bus(), 100'000);
  }
  ASSERT_EQ(order.size(), kCount);
  for (std::uint64_t i = 0; i < kCount; ++i) EXPECT_EQ(order[i], i);
}

TEST_F(DBusListenerConcurrencyTest, TwoConnectionsAreHandledInParallel) {
  std::mutex mutex;
  std::condition_variable changed;
  int inside = 0;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    std::unique_lock lock(mutex);
    ++inside;
    changed.notify_all();
    // Each handler waits for the other: only parallel handling lets both meet.
    const bool met = changed.wait_for(lock, kTimeout, [&] { return inside >= 2; });
    lock.unlock();
    auto reply = *message.makeReply();
    reply.setBoolean("Met", met);
    connection->sendReply(message, std::move(reply));
  });
  std::vector<CallResult> results(2);
  std::vector<std::thread> clients;
  for (auto& result : results) {
    clients.emplace_back([&] { result = Client(address()).call(MessageDictionary()); });
  }
  for (auto& thread : clients) thread.join();
  for (const auto& result : results) {
    ASSERT_GE(result.status, 0) << result.errorName;
    EXPECT_TRUE(result.reply.boolean("Met"));
  }
}

TEST_F(DBusListenerConcurrencyTest, DeferredReplyFromAnotherThread) {
  std::mutex mutex;
  std::vector<std::thread> repliers;
  std::atomic<int> secondReplies{0};
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    // Return at once; answer later from a thread of our own.
    std::lock_guard lock(mutex);
    repliers.emplace_back([&secondReplies, connection, message] {
      std::this_thread::sleep_for(20ms);
      auto reply = *message.makeReply();
      reply.setString("From", "later");
      EXPECT_TRUE(connection->sendReply(message, reply));
      if (connection->sendReply(message, reply)) ++secondReplies;
    });
  });
  Client client(address());
  for (int i = 0; i < 3; ++i) {
    const CallResult result = client.call(MessageDictionary());
    ASSERT_GE(result.status, 0) << result.errorName;
    EXPECT_EQ(result.reply.string("From"), "later");
  }
  std::lock_guard lock(mutex);
  for (auto& thread : repliers) thread.join();
  EXPECT_EQ(secondReplies.load(), 0);
}

TEST_F(DBusListenerConcurrencyTest, ClientThatLeavesMidRequestDoesNotDisturbOthers) {
  Signal received;
  Signal release;
  Signal finished;
  listen([&](std::shared_ptr<MessageConnection> connection, ReceivedMessage message) {
    if (message.dictionary().boolean("Hold")) {
      EXPECT_TRUE(message.hasReplyContext());
      received.set();
      release.wait();
      // Whether the hang-up was seen yet or not, the reply goes nowhere.
      connection->sendReply(message, message.makeReply().value_or(MessageDictionary()));
      finished.set();
      return;
    }
    connection->sendReply(message, *message.makeReply());
  });
  {
    Client leaving(address());
    MessageDictionary hold;
    hold.setBoolean("Hold", true);
    MessagePtr m = leaving.newRequest(hold);
    // With a callback: without one, sd-bus flags the call as expecting no reply.
    auto ignore = [](sd_bus_message*, void*, sd_bus_error*) { return 0; };
    ASSERT_GE(sd_bus_call_async(leaving.bus(), nullptr, m.get(), ignore, nullptr, kCallTimeoutUsec),
              0);
    ASSERT_GE(sd_bus_flush(leaving.bus()), 0);
    ASSERT_TRUE(received.wait());
  }  // disconnects with the request still in the handler
  Client other(address());
  ASSERT_GE(other.call(MessageDictionary()).status, 0);
  std::this_thread::sleep_for(20ms);  // most likely the hang-up is seen before the reply
  release.set();
  for (int i = 0; i < 5; ++i) {
    EXPECT_GE(other.call(withSeq(static_cast<std::uint64_t>(i))).status, 0);
  }
  Client third(address());
  EXPECT_GE(third.call(MessageDictionary()).status, 0);
  EXPECT_TRUE(finished.wait());
}

}  // namespace
}  // namespace kestrel::platform
