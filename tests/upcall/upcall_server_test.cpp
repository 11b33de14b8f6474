// The upcall server's checks of a message, through the channel's handler with
// the store on a scratch root.
#include "upcall/upcall_server.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>

#include "daemon/startup.h"
#include "support/fake_services.h"
#include "support/upcall_requests.h"
#include "upcall/upcall_items.h"
#include "upcall/upcall_messages.h"

namespace kestrel {
namespace {

using testing::UpcallItem;
using namespace upcall_field;

constexpr platform::UpcallPeer kKernel{4711, 0, 0};
constexpr platform::UpcallPeer kUser{4712, 501, 501};

void setWord(std::vector<std::uint8_t>& bytes, std::size_t offset, std::uint32_t value) {
  std::memcpy(bytes.data() + offset, &value, sizeof value);
}

TEST(UpcallServerTest, MessagesAreCheckedBeforeTheRoutineRuns) {
  testing::FakeServices fakes;
  ASSERT_TRUE(KSTKernServerStart());
  const std::vector<std::uint8_t> good = testing::upcallRequest(
      {UpcallItem::string(0, "com.example.app"), UpcallItem::number(3, 501)});

  struct Row {
    const char* name;
    std::function<void(std::vector<std::uint8_t>&)> change;
    platform::UpcallPeer peer;
    std::optional<std::int32_t> code;  // nothing: no reply, the connection goes
  };
  const Row rows[] = {
      {"a request", [](auto&) {}, kKernel, 0},
      {"another server's id", [](auto& m) { setWord(m, kId, 322514902); }, kKernel, std::nullopt},
      {"the id after the routine's", [](auto& m) { setWord(m, kId, 322514901); }, kKernel, -303},
      {"not complex", [](auto& m) { setWord(m, kBits, 0x12); }, kKernel, -304},
      {"two descriptors", [](auto& m) { setWord(m, kDescriptorCount, 2); }, kKernel, -304},
      {"a 48-byte message", [](auto& m) { setWord(m, kSize, 48); }, kKernel, -304},
      {"not out-of-line memory", [](auto& m) { m[kDescriptorType] = 2; }, kKernel, -300},
      {"sizes that differ", [](auto& m) { setWord(m, kRepeatedSize, 8); }, kKernel, -300},
      {"a region beyond the datagram",
       [](auto& m) {
         setWord(m, kOutOfLineSize, 4096);
         setWord(m, kRepeatedSize, 4096);
       },
       kKernel, -300},
      {"a region inside the fixed part", [](auto& m) { setWord(m, kAddress, 8); }, kKernel, -300},
      {"a sender that is not the kernel", [](auto&) {}, kUser, 5},
      {"shorter than a header", [](auto& m) { m.resize(20); }, kKernel, std::nullopt},
      {"a size beyond the datagram", [](auto& m) { setWord(m, kSize, 4000); }, kKernel,
       std::nullopt},
      {"larger than the server takes", [](auto& m) { setWord(m, kSize, 56); }, kKernel,
       std::nullopt},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<std::uint8_t> message = good;
    row.change(message);
    const auto reply = fakes.upcall->deliver(message, row.peer);
    ASSERT_EQ(reply.has_value(), row.code.has_value());
    if (!reply) continue;
    std::string error;
    const auto parsed = KSTUpcallParseReply(*reply, &error);
    ASSERT_TRUE(parsed) << error;
    EXPECT_EQ(parsed->id, KSTUpcallWord(message, kId) + 100);
    EXPECT_EQ(parsed->returnCode, *row.code);
    EXPECT_EQ(KSTUpcallWord(*reply, kRemotePort), 77u);  // back to the reply port
    EXPECT_EQ(KSTUpcallWord(*reply, kBits) & 0x1f, 18u);
    if (*row.code == 0) {
      EXPECT_EQ((*reply)[kDeallocate], 1);
    }
  }
}

// Requests that cannot be read get 4 or 5 and no region, with the log line.
TEST(UpcallServerTest, UnreadableItemsAreRefused) {
  testing::FakeServices fakes;
  struct Row {
    const char* name;
    std::vector<UpcallItem> items;
    std::int32_t code;
    const char* logged;
  };
  const Row rows[] = {
      {"value type 8",
       {UpcallItem::string(0, "a"), UpcallItem::number(8, 1)},
       4,
       "unexpected value: 8\n"},
      {"a persona that is a string",
       {UpcallItem::string(3, "501")},
       5,
       "failed: to unpack uint32 for KS_KERN_REQUEST_PERSONA_ID. error: 22\n"},
      {"a container type that is a string",
       {UpcallItem::string(5, "1")},
       5,
       "failed: to unpack uint32 for KS_KERN_REQUEST_CONTAINER_TYPE. error: 22\n"},
      {"a group that is a number",
       {UpcallItem::number(4, 7)},
       5,
       "failed: to unpack string for KS_KERN_REQUEST_APP_GROUP_ID. error: 22\n"},
      {"a string without its NUL",
       {UpcallItem::raw(2, 0, {'a', 'b', 'c'}, 3)},
       5,
       "failed: to unpack string for KS_KERN_REQUEST_CODE_SIGNATURE_ID. error: 22\n"},
      {"a system container beyond the end",
       {UpcallItem::raw(2, 6, {'x', 0}, 64)},
       5,
       "failed: to unpack string for KS_KERN_REQUEST_CONTAINER_ID. error: 34\n"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    KSTUpcallOutOfLine reply;
    const auto packed = testing::packedItems(row.items);
    EXPECT_EQ(server_get_process_containers(0, packed, &reply), row.code);
    EXPECT_TRUE(reply.bytes.empty());
    EXPECT_TRUE(fakes.logged(row.logged, testing::Match::Exact));
  }
}

}  // namespace
}  // namespace kestrel
