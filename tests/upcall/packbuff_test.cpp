// The packed buffer, checked on its bytes.
#include "upcall/packbuff.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "platform/memory_region.h"
#include "support/upcall_requests.h"

namespace kestrel {
namespace {

using testing::UpcallItem;

std::vector<std::uint8_t> contents(const packbuff* handle) {
  const std::uint8_t* bytes = sb_packbuff_get_bytes(handle);
  return std::vector<std::uint8_t>(bytes, bytes + sb_packbuff_get_size(handle));
}

TEST(PackbuffTest, ItemsAreAlignedAndTheBufferEnded) {
  PackbuffRef handle = sb_packbuff_new(4);  // below 8: blocks of 256
  ASSERT_TRUE(handle);
  EXPECT_EQ(handle->block_size, 256u);
  EXPECT_EQ(sb_packbuff_get_size(handle.get()), 8u);
  EXPECT_FALSE(sb_packbuff_get_item_value_type(handle.get(), nullptr));

  ASSERT_EQ(sb_packbuff_pack_string(handle.get(), 7, "abc", 3), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(handle.get(), 9, 0xdeadbeef), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(handle.get(), 5, "12345678", 8), 0);
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(handle.get(), 3, "g", 4, ""), 0);
  const std::vector<std::uint8_t> expected = {
      2,   0,   7,   0,   4,    0,    0,    0,
      'a', 'b', 'c', 0,   0,    0,    0,    0,     // "abc", NUL, 3 pad
      1,   0,   9,   0,   0xef, 0xbe, 0xad, 0xde,  // inline value
      3,   0,   5,   0,   8,    0,    0,    0,
      '1', '2', '3', '4', '5',  '6',  '7',  '8',  // no padding
      2,   0,   3,   0,   2,    0,    0,    0,
      'g', 0,   0,   0,   0,    0,    0,    0,  // key
      2,   0,   4,   0,   1,    0,    0,    0,
      0,   0,   0,   0,   0,    0,    0,    0,   // empty value
      0,   0,   0,   0,   0,    0,    0,    0};  // end
  EXPECT_EQ(contents(handle.get()), expected);
  EXPECT_EQ(handle->bytes_remaining, handle->bytes_allocated - expected.size());
}

// A small-block buffer grows as items come; read back from an unaligned copy,
// every item is there, and the reader stops at the end item.
TEST(PackbuffTest, GrowsAndReadsBackInPlace) {
  PackbuffRef writer = sb_packbuff_new(16);
  std::size_t allocated = writer->bytes_allocated;
  for (std::uint16_t i = 0; i < 20; ++i) {
    const std::string text(i * 15u, 'x');
    ASSERT_EQ(sb_packbuff_pack_string(writer.get(), i, text.c_str(), text.size()), 0) << i;
    EXPECT_GE(writer->bytes_allocated, allocated);
    EXPECT_TRUE(writer->bytes_allocated == allocated ||
                writer->bytes_allocated >= allocated + writer->block_size);
    allocated = writer->bytes_allocated;
    ASSERT_EQ(sb_packbuff_pack_uint32(writer.get(), 1000 + i, i), 0);
  }
  std::vector<std::uint8_t> copy(sb_packbuff_get_size(writer.get()) + 1);
  std::memcpy(copy.data() + 1, sb_packbuff_get_bytes(writer.get()), copy.size() - 1);
  PackbuffRef reader =
      sb_packbuff_init_with_buffer(copy.data() + 1, copy.size() - 1, true, kSBPackbuffDeallocNone);
  std::uint16_t valueType = 0;
  for (std::uint16_t i = 0; i < 20; ++i) {
    ASSERT_TRUE(sb_packbuff_get_item_value_type(reader.get(), &valueType));
    EXPECT_EQ(valueType, i);
    int error = -1;
    std::size_t length = 0;
    const char* text = sb_packbuff_unpack_string(reader.get(), &length, &error);
    ASSERT_EQ(error, 0);
    EXPECT_EQ(std::string(text, length), std::string(i * 15u, 'x'));
    EXPECT_EQ(sb_packbuff_unpack_uint32(reader.get(), &error), i);
    EXPECT_EQ(error, 0);
  }
  EXPECT_FALSE(sb_packbuff_get_item_value_type(reader.get(), &valueType));
}

TEST(PackbuffTest, FailuresLeaveTheBufferAsItWas) {
  struct Row {
    const char* name;
    std::vector<UpcallItem> items;  // the buffer read, or nothing: a new growable one
    std::size_t wrappedSize;        // nonzero: a wrapped buffer of this size to write into
    std::function<int(packbuff*)> operation;
    int error;
  };
  const auto unpackString = [](packbuff* b) {
    int error = 0;
    std::size_t length = 99;
    sb_packbuff_unpack_string(b, &length, &error);
    EXPECT_EQ(length, 99u);
    return error;
  };
  const auto unpackNumber = [](packbuff* b) {
    int error = 0;
    sb_packbuff_unpack_uint32(b, &error);
    return error;
  };
  const Row rows[] = {
      {"a string whose byte at the length is not NUL",
       {},
       0,
       [](packbuff* b) { return sb_packbuff_pack_string(b, 1, "abcd", 3); },
       EINVAL},
      {"a length of all ones",
       {},
       0,
       [](packbuff* b) { return sb_packbuff_pack_string(b, 1, "", SIZE_MAX); },
       EINVAL},
      {"bytes without a payload",
       {},
       0,
       [](packbuff* b) { return sb_packbuff_pack_bytes(b, 1, nullptr, 4); },
       EINVAL},
      {"a wrapped buffer that is full",
       {},
       16,
       [](packbuff* b) {
         EXPECT_EQ(sb_packbuff_pack_uint32(b, 1, 1), 0);  // fills it: 8 + the end item
         return sb_packbuff_pack_uint32(b, 1, 2);
       },
       ENOTSUP},
      {"a string read as a number", {UpcallItem::string(1, "abc")}, 0, unpackNumber, EINVAL},
      {"a number read as a string", {UpcallItem::number(1, 5)}, 0, unpackString, EINVAL},
      {"an empty string payload", {UpcallItem::raw(2, 1, {}, 0)}, 0, unpackString, EINVAL},
      {"a string without its NUL", {UpcallItem::raw(2, 1, {'a', 'b'}, 2)}, 0, unpackString, EINVAL},
      {"a payload running past the end",
       {UpcallItem::raw(2, 1, {'a', 0}, 200)},
       0,
       unpackString,
       ERANGE},
      {"a key whose value is a number",
       {UpcallItem::string(3, "g"), UpcallItem::number(4, 1)},
       0,
       [](packbuff* b) {
         return sb_packbuff_unpack_key_with_string_value(b, nullptr, nullptr, nullptr, nullptr);
       },
       EINVAL},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<std::uint8_t> bytes = testing::packedItems(row.items);
    if (row.wrappedSize != 0) bytes.resize(row.wrappedSize);
    PackbuffRef handle = row.items.empty() && row.wrappedSize == 0 ? sb_packbuff_new(64)
                         : row.items.empty()
                             ? sb_packbuff_init_with_buffer(bytes.data(), row.wrappedSize, false,
                                                            kSBPackbuffDeallocNone)
                             : sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true,
                                                            kSBPackbuffDeallocNone);
    ASSERT_TRUE(handle);
    const packbuff before = *handle;
    const std::vector<std::uint8_t> beforeBytes = contents(handle.get());
    EXPECT_EQ(row.operation(handle.get()), row.error);
    if (row.wrappedSize != 0) continue;  // the first of its two items went in
    EXPECT_EQ(handle->item, before.item);
    EXPECT_EQ(handle->bytes_used, before.bytes_used);
    EXPECT_EQ(contents(handle.get()), beforeBytes);
  }
}

// The reader needs an end item after every item: one that runs to the last
// byte is out of range, as is a current item outside the buffer.
TEST(PackbuffTest, ReadingStopsAtTheBufferBounds) {
  std::vector<std::uint8_t> bytes = testing::packedItems({UpcallItem::string(1, "abcdefg")});
  PackbuffRef whole =
      sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, kSBPackbuffDeallocNone);
  PackbuffRef cut =
      sb_packbuff_init_with_buffer(bytes.data(), bytes.size() - 8, true, kSBPackbuffDeallocNone);
  int error = -1;
  EXPECT_STREQ(sb_packbuff_unpack_string(whole.get(), nullptr, &error), "abcdefg");
  EXPECT_EQ(error, 0);
  EXPECT_EQ(sb_packbuff_unpack_string(cut.get(), nullptr, &error), nullptr);
  EXPECT_EQ(error, ERANGE);
  cut->item = cut->item_buffer + cut->bytes_allocated;
  EXPECT_FALSE(sb_packbuff_get_item_value_type(cut.get(), nullptr));
  sb_packbuff_unpack_uint32(cut.get(), &error);
  EXPECT_EQ(error, ERANGE);
}

TEST(PackbuffTest, DumpShowsEveryItemAndTheCurrentOne) {
  PackbuffRef handle = sb_packbuff_new(64);
  sb_packbuff_pack_uint32(handle.get(), 0, 1);
  sb_packbuff_pack_string(handle.get(), 100, "/home", 5);
  std::uint8_t* base = handle->item_buffer;
  char expected[1024];
  std::snprintf(expected, sizeof expected,
                "packbuff: %p\n  block_size:      64\n  dealloc_type:    free()\n"
                "  bytes_allocated: 64\n  bytes_used:      32\n  bytes_remaining: 32\n"
                "  item_buffer %p, item: %p\n\n"
                "   0:%p -- value type 0 --inline value: 1\n"
                "   1:%p -- value type 100 --string (%p, 2 pad bytes, size: 6): \n     `/home'\n"
                "*  2: %p -- END\n",
                static_cast<void*>(handle.get()), static_cast<void*>(base),
                static_cast<void*>(base + 24), static_cast<void*>(base),
                static_cast<void*>(base + 8), static_cast<void*>(base + 16),
                static_cast<void*>(base + 24));
  ::testing::internal::CaptureStdout();
  sb_packbuff_print(handle.get());
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), expected);

  sb_packbuff_set_size(handle.get(), 20);  // the string now runs past the end
  ::testing::internal::CaptureStdout();
  sb_packbuff_print(handle.get());
  EXPECT_TRUE(::testing::internal::GetCapturedStdout().ends_with(
      "size: 6): \n     `/hom'\n>> item pointer exceeds end of buffer. <<\n"));
}

TEST(PackbuffTest, MemoryRegionsAreReleasedWithTheirHandle) {
  void* region = platform::allocateMemoryRegion(4096);
  ASSERT_NE(region, nullptr);
  ::testing::internal::CaptureStdout();
  sb_packbuff_free(
      sb_packbuff_init_with_buffer(region, 4096, false, kSBPackbuffDeallocVM).release());
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), "");

  region = platform::allocateMemoryRegion(4096);
  ::testing::internal::CaptureStdout();
  sb_packbuff_init_with_buffer(region, 0, true, kSBPackbuffDeallocVM).reset();  // size 0: refused
  char expected[64];
  std::snprintf(expected, sizeof expected, "failed: vm_deallocate(%p, 0)\n", region);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), expected);
  EXPECT_EQ(platform::releaseMemoryRegion(region, 4096), 0);
}

}  // namespace
}  // namespace kestrel
