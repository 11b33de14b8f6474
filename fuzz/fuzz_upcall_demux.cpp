// A whole upcall datagram from the kernel (a root sender) through the
// channel's split into message and region, and demux_server, with the real
// store on the scratch root. A datagram is refused by the channel, not
// answered (another server's id), or answered with a reply that parses, whose
// id is the request's + 100 and whose code is one the server gives; a reply
// of code 0 lists its items in their order, ends with the status, holds only
// the status when that is 0, and names containers that exist.
#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/sandbox.h"
#include "platform/services.h"
#include "platform/upcall_channel.h"
#include "store/container_cache.h"
#include "support/fuzz_environment.h"
#include "upcall/packbuff.h"
#include "upcall/upcall_items.h"
#include "upcall/upcall_messages.h"
#include "upcall/upcall_server.h"

namespace {

using namespace kestrel;

// The sandbox's table would keep an item for every identifier ever made.
class DiscardingSandbox final : public platform::Sandbox {
 public:
  int setUserStateItem(std::uint32_t, std::uint64_t, const std::string&,
                       const std::optional<std::string>&, std::uint64_t) override {
    return 0;
  }
  std::optional<std::string> userStateItem(std::uint32_t, std::uint64_t,
                                           const std::string&) const override {
    return std::nullopt;
  }
  std::vector<platform::SandboxUserStateItem> userStateItems() const override { return {}; }
};

constexpr platform::UpcallPeer kKernel{1, 0, 0};
// Made containers are removed every so many inputs, so that the store stays small.
constexpr unsigned kInputsBetweenWipes = 1024;
constexpr std::uint32_t kOtherUsers[] = {503, 4294967294u};
constexpr std::uint32_t kUsers[] = {0, 1, 33, 499, 501, 502, 503, 4294967294u};

const platform::FilesystemRoot& setUp() {
  static const bool ready = [] {
    fuzz::environment();
    platform::Services services = platform::services();
    services.sandbox = std::make_shared<DiscardingSandbox>();
    platform::installServices(std::move(services));
    return true;
  }();
  (void)ready;
  return fuzz::environment();
}

void wipeStore(const platform::FilesystemRoot& root) {
  for (const char* directory :
       {"/private/var/mobile/Containers", "/private/var/mobile2/Containers",
        "/private/var/containers", "/private/var/root/Library/Caches/com.zorvane.kestreld"}) {
    std::error_code ec;
    std::filesystem::remove_all(root.resolve(directory), ec);
  }
  for (std::uint32_t user : kUsers) {
    for (KSTContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
      KSTContainerCache::sharedInstance()._discardClassMapForUser(user, containerClass, false);
      KSTContainerCache::sharedInstance()._discardClassMapForUser(user, containerClass, true);
    }
  }
}

// The store keeps a configuration for every user id above 500 it is asked
// about: personas above the two mobile users are folded onto two others.
void foldPersonas(std::vector<std::uint8_t>& datagram) {
  const std::uint32_t address = KSTUpcallWord(datagram, upcall_field::kAddress);
  const std::uint32_t size = KSTUpcallWord(datagram, upcall_field::kOutOfLineSize);
  if (std::uint64_t{address} + size > datagram.size() || size == 0) return;
  PackbuffRef buffer =
      sb_packbuff_init_with_buffer(datagram.data() + address, size, true, kSBPackbuffDeallocNone);
  std::uint16_t valueType = 0;
  while (buffer && sb_packbuff_get_item_value_type(buffer.get(), &valueType)) {
    std::uint16_t type = 0;
    std::memcpy(&type, buffer->item, sizeof type);
    int error = 0;
    if (type == kSBPackbuffItemUInt32) {
      std::uint8_t* value = buffer->item + 4;
      const std::uint32_t persona = sb_packbuff_unpack_uint32(buffer.get(), &error);
      if (error == 0 && valueType == kKSTUpcallRequestPersonaId && persona > 502) {
        std::memcpy(value, &kOtherUsers[persona % 2], sizeof persona);
      }
    } else if (type == kSBPackbuffItemString) {
      sb_packbuff_unpack_string(buffer.get(), nullptr, &error);
    } else if (type == kSBPackbuffItemBytes) {
      sb_packbuff_unpack_bytes(buffer.get(), nullptr, &error);
    } else {
      return;
    }
    if (error != 0) return;
  }
}

bool exists(const std::string& path) {
  struct stat st = {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The rank of a reply item: items come in rank order.
int rankOf(std::uint16_t valueType) {
  switch (valueType) {
    case kKSTUpcallReplyHomeDirectory:
      return 0;
    case kKSTUpcallReplyDataContainer:
      return 1;
    case kKSTUpcallReplyTemporaryDirectory:
      return 2;
    case kKSTUpcallReplyGroupId:
    case kKSTUpcallReplyGroupContainer:
      return 3;
    case kKSTUpcallReplySystemContainer:
      return 4;
    case kKSTUpcallReplySystemGroupId:
    case kKSTUpcallReplySystemGroupContainer:
      return 5;
    case kKSTUpcallReplyStatus:
      return 6;
    default:
      return -1;
  }
}

void checkRegion(std::span<const std::uint8_t> region, const std::string& root) {
  std::vector<std::uint8_t> copy(region.begin(), region.end());
  PackbuffRef buffer =
      sb_packbuff_init_with_buffer(copy.data(), copy.size(), true, kSBPackbuffDeallocNone);
  KESTREL_FUZZ_CHECK(buffer, "an empty reply region");
  std::vector<std::uint16_t> types;
  std::vector<std::string> values;
  std::optional<std::uint32_t> status;
  std::uint16_t valueType = 0;
  while (sb_packbuff_get_item_value_type(buffer.get(), &valueType)) {
    KESTREL_FUZZ_CHECK(!status, "an item after the status");
    int error = 0;
    if (valueType == kKSTUpcallReplyStatus) {
      status = sb_packbuff_unpack_uint32(buffer.get(), &error);
      values.emplace_back();
    } else {
      const char* text = sb_packbuff_unpack_string(buffer.get(), nullptr, &error);
      if (error == 0) values.emplace_back(text);
    }
    KESTREL_FUZZ_CHECK(error == 0, "a reply item that cannot be read: " + std::to_string(error));
    const int rank = rankOf(valueType);
    KESTREL_FUZZ_CHECK(rank >= 0, "value type " + std::to_string(valueType));
    KESTREL_FUZZ_CHECK(types.empty() || rankOf(types.back()) <= rank, "items out of order");
    types.push_back(valueType);
  }
  KESTREL_FUZZ_CHECK(status && (*status == 0 || *status == 1), "no status, or not 0 or 1");
  if (*status == 0) {
    KESTREL_FUZZ_CHECK(types.size() == 1, "status 0 with paths");
    return;
  }
  for (std::size_t i = 0; i + 1 < types.size(); ++i) {
    const std::uint16_t type = types[i];
    const bool key = type == kKSTUpcallReplyGroupId || type == kKSTUpcallReplySystemGroupId;
    if (key) {
      KESTREL_FUZZ_CHECK(types[i + 1] == type + 1, "a group without its container");
      continue;
    }
    KESTREL_FUZZ_CHECK(values[i].starts_with(root), "a path outside the root: " + values[i]);
    if (type == kKSTUpcallReplyDataContainer) {
      KESTREL_FUZZ_CHECK(
          types[i + 1] == kKSTUpcallReplyTemporaryDirectory && values[i + 1] == values[i] + "/tmp",
          "a data container without its tmp");
    }
    if (type == kKSTUpcallReplyDataContainer || type == kKSTUpcallReplyGroupContainer ||
        type == kKSTUpcallReplySystemContainer || type == kKSTUpcallReplySystemGroupContainer) {
      KESTREL_FUZZ_CHECK(exists(values[i]), "a container that is not there: " + values[i]);
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const platform::FilesystemRoot& root = setUp();
  static unsigned inputs = 0;
  if (++inputs % kInputsBetweenWipes == 0) wipeStore(root);

  std::vector<std::uint8_t> datagram(data, data + size);
  foldPersonas(datagram);
  const std::uint32_t id = KSTUpcallWord(datagram, upcall_field::kId);
  std::optional<platform::UpcallMessage> message = platform::UpcallMessage::fromDatagram(
      datagram, kKernel, kKSTUpcallMessageSize, inputs, nullptr);
  if (!message) return 0;
  const std::optional<std::vector<std::uint8_t>> reply = KSTUpcallReceive(*message);
  const bool ours = id == kKSTUpcallProcessContainersId || id == kKSTUpcallUnservedId;
  KESTREL_FUZZ_CHECK(reply.has_value() == ours, "answered: " + std::to_string(reply.has_value()));
  if (!reply) return 0;

  std::string error;
  const std::optional<KSTUpcallReply> parsed = KSTUpcallParseReply(*reply, &error);
  KESTREL_FUZZ_CHECK(parsed, "a reply that does not parse: " + error);
  KESTREL_FUZZ_CHECK(parsed->id == id + 100, "a reply with id " + std::to_string(parsed->id));
  const std::int32_t code = parsed->returnCode;
  KESTREL_FUZZ_CHECK(
      code == 0 || code == 4 || code == 5 || code == -300 || code == -303 || code == -304,
      "return code " + std::to_string(code));
  if (code == 0) checkRegion(parsed->region, root.path());
  return 0;
}
