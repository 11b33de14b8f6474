// A packed request buffer as the upcall server reads it: every item read in
// place by its own type (and tried with a wrong type first), then written
// again into a growable buffer and into a fixed one, and read back. A read
// either moves to the next 8-aligned item or fails with 22 or 34 and stays;
// what was read comes back the same; the dump walks any buffer.
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "support/fuzz_environment.h"
#include "upcall/packbuff.h"

namespace {

using namespace kestrel;
using kestrel::fuzz::fail;

struct Item {
  std::uint16_t type = 0;
  std::uint16_t valueType = 0;
  std::uint32_t number = 0;
  std::string payload;  // a string without its NUL, or the bytes
};

std::uint16_t itemTypeAt(const packbuff* buffer) {
  std::uint16_t type = 0;
  std::memcpy(&type, buffer->item, sizeof type);
  return type;
}

// Reads the items as a reader that knows their types does; stops at the end
// item or at the first item that cannot be read.
std::vector<Item> readAll(packbuff* buffer) {
  std::vector<Item> items;
  std::uint16_t valueType = 0;
  while (sb_packbuff_get_item_value_type(buffer, &valueType)) {
    std::uint8_t* const at = buffer->item;
    const std::uint16_t type = itemTypeAt(buffer);
    int error = -1;
    // A wrong type never reads and never moves.
    if (type != kSBPackbuffItemUInt32) {
      sb_packbuff_unpack_uint32(buffer, &error);
    } else {
      sb_packbuff_unpack_string(buffer, nullptr, &error);
    }
    KESTREL_FUZZ_CHECK(error == EINVAL && buffer->item == at, "a wrong type was read");

    Item item{type, valueType, 0, {}};
    std::size_t length = 0;
    if (type == kSBPackbuffItemUInt32) {
      item.number = sb_packbuff_unpack_uint32(buffer, &error);
    } else if (type == kSBPackbuffItemString) {
      const char* text = sb_packbuff_unpack_string(buffer, &length, &error);
      if (error == 0) {
        KESTREL_FUZZ_CHECK(text[length] == '\0', "a string without its NUL");
        item.payload.assign(text, length);
      }
    } else if (type == kSBPackbuffItemBytes) {
      const void* bytes = sb_packbuff_unpack_bytes(buffer, &length, &error);
      if (error == 0) item.payload.assign(static_cast<const char*>(bytes), length);
    } else {
      break;  // no reader for it: the server stops here too
    }
    if (error != 0) {
      KESTREL_FUZZ_CHECK(error == EINVAL || error == ERANGE, "error " + std::to_string(error));
      KESTREL_FUZZ_CHECK(buffer->item == at, "a failed read moved");
      break;
    }
    const std::size_t moved = static_cast<std::size_t>(buffer->item - at);
    KESTREL_FUZZ_CHECK(moved % 8 == 0 && moved >= 8, "moved by " + std::to_string(moved));
    KESTREL_FUZZ_CHECK(
        static_cast<std::size_t>(buffer->item - buffer->item_buffer) < buffer->bytes_allocated,
        "moved out of the buffer");
    items.push_back(std::move(item));
  }
  return items;
}

int pack(packbuff* buffer, const Item& item) {
  switch (item.type) {
    case kSBPackbuffItemUInt32:
      return sb_packbuff_pack_uint32(buffer, item.valueType, item.number);
    case kSBPackbuffItemString:
      return sb_packbuff_pack_string(buffer, item.valueType, item.payload.c_str(),
                                     item.payload.size());
    default:
      return sb_packbuff_pack_bytes(buffer, item.valueType, item.payload.data(),
                                    item.payload.size());
  }
}

bool sameItems(const std::vector<Item>& a, const std::vector<Item>& b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (a[i].type != b[i].type || a[i].valueType != b[i].valueType || a[i].number != b[i].number ||
        a[i].payload != b[i].payload) {
      return false;
    }
  }
  return true;
}

std::vector<Item> readBack(const packbuff* written) {
  std::vector<std::uint8_t> copy(sb_packbuff_get_bytes(written),
                                 sb_packbuff_get_bytes(written) + sb_packbuff_get_size(written));
  PackbuffRef reader =
      sb_packbuff_init_with_buffer(copy.data(), copy.size(), true, kSBPackbuffDeallocNone);
  if (!reader) fail("cannot wrap a written buffer");
  return readAll(reader.get());
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // The dump goes to standard output, which nobody reads here.
  if (std::freopen("/dev/null", "w", stdout) == nullptr) fail("cannot silence standard output");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  // A buffer of its own, so that ASan sees every byte read beyond it.
  std::vector<std::uint8_t> bytes(data, data + size);
  PackbuffRef buffer =
      sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, kSBPackbuffDeallocNone);
  if (!buffer) return 0;  // an empty input has no buffer
  if (fuzz::sampled({data, size}, 8)) sb_packbuff_print(buffer.get());
  const std::vector<Item> items = readAll(buffer.get());

  // Growable, in blocks drawn from the input: everything fits, and reads back.
  PackbuffRef grown = sb_packbuff_new(size == 0 ? 0 : std::size_t{data[0]} * 8);
  if (!grown) fail("no growable buffer");
  for (const Item& item : items) {
    if (const int error = pack(grown.get(), item)) fail("packing failed", std::to_string(error));
  }
  KESTREL_FUZZ_CHECK(sb_packbuff_get_size(grown.get()) % 8 == 0, "an unaligned size");
  KESTREL_FUZZ_CHECK(grown->bytes_used + grown->bytes_remaining == grown->bytes_allocated,
                     "counts that do not add up");
  KESTREL_FUZZ_CHECK(sameItems(readBack(grown.get()), items), "a growable round trip changed");

  // Fixed, as large as the input: full at some item, but never beyond.
  std::vector<std::uint8_t> room(size < 8 ? 8 : size);
  PackbuffRef fixed =
      sb_packbuff_init_with_buffer(room.data(), room.size(), false, kSBPackbuffDeallocNone);
  std::size_t packed = 0;
  for (const Item& item : items) {
    const std::size_t used = fixed->bytes_used;
    const int error = pack(fixed.get(), item);
    if (error != 0) {
      KESTREL_FUZZ_CHECK(error == ENOTSUP || error == ERANGE, "error " + std::to_string(error));
      KESTREL_FUZZ_CHECK(fixed->bytes_used == used, "a failed pack wrote");
      break;
    }
    ++packed;
  }
  const std::vector<Item> prefix(items.begin(), items.begin() + static_cast<long>(packed));
  KESTREL_FUZZ_CHECK(sameItems(readBack(fixed.get()), prefix), "a fixed round trip changed");
  return 0;
}
