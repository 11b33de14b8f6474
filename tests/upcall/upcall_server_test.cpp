#include "upcall/upcall_server.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <thread>

#include "daemon/startup.h"
#include "platform/linux/upcall_channel_linux.h"
#include "platform/unique_fd.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

std::vector<std::uint8_t> requestHeader(std::uint32_t bits, std::uint32_t replyPort,
                                        std::uint32_t id) {
  std::vector<std::uint8_t> message(52, 0);
  auto put = [&](std::size_t offset, std::uint32_t value) {
    for (std::size_t i = 0; i < 4; ++i) message[offset + i] = std::uint8_t(value >> (8 * i));
  };
  put(0, bits);
  put(4, 52);
  put(8, replyPort);
  put(20, id);
  return message;
}

std::uint32_t word(const std::vector<std::uint8_t>& bytes, std::size_t offset) {
  std::uint32_t value = 0;
  for (std::size_t i = 0; i < 4; ++i) value |= std::uint32_t(bytes[offset + i]) << (8 * i);
  return value;
}

TEST(UpcallServerTest, ErrorReplyMirrorsTheRequestHeader) {
  const auto reply = KSTUpcallErrorReply(requestHeader(0x80000012, 7, 322514900), -303);
  ASSERT_EQ(reply.size(), 36u);
  EXPECT_EQ(word(reply, 0), 0x12u);  // reply disposition, not complex
  EXPECT_EQ(word(reply, 4), 36u);
  EXPECT_EQ(word(reply, 8), 7u);
  EXPECT_EQ(word(reply, 20), 322515000u);
  EXPECT_EQ(word(reply, 28), 1u);  // the data-representation record: 00 00 00 00 01 00 00 00
  EXPECT_EQ(static_cast<std::int32_t>(word(reply, 32)), -303);
  EXPECT_FALSE(KSTUpcallReceive(std::vector<std::uint8_t>(10, 0), {}).has_value());
}

// The daemon's upcall socket answers a datagram from another thread through
// the main queue.
TEST(UpcallServerTest, LinuxChannelAnswersOnTheMainQueue) {
  testing::FakeServices fakes;
  fakes.services.upcall = platform::makeLinuxUpcallChannel(fakes.scratch.root());
  fakes.install();
  ASSERT_TRUE(KSTKernServerStart());

  std::vector<std::uint8_t> reply(64);
  ssize_t replySize = -1;
  std::thread client([&] {
    platform::UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    const std::string path = fakes.scratch.resolve("/run/kestrel/com.zorvane.kestreld.upcall");
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) {
      const auto request = requestHeader(0x80000000, 0, 322514900);
      ::send(fd.get(), request.data(), request.size(), 0);
      replySize = ::recv(fd.get(), reply.data(), reply.size(), 0);
    }
    platform::DispatchQueue::main()->async([] { platform::stopMainLoop(0); });
  });
  platform::runMainLoop();
  client.join();
  ASSERT_EQ(replySize, 36);
  reply.resize(36);
  EXPECT_EQ(word(reply, 20), 322515000u);
  EXPECT_EQ(static_cast<std::int32_t>(word(reply, 32)), kKSTUpcallBadId);
}

}  // namespace
}  // namespace kestrel
