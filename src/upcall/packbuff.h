// The packed buffer ("packbuff") that carries the sandbox's upcall request and
// its reply: a flat sequence of typed, tagged items, each starting at a
// multiple of 8 bytes from the buffer's start, ended by an all-zero item.
//
// Item layout (integers in the machine's order):
//   0  uint16  item type: 0 end, 1 inline 32-bit value, 2 string, 3 bytes
//   2  uint16  value type: the caller's tag for what the item means
//   4  uint32  type 1: the value; types 2 and 3: the payload length (a
//              string's includes its NUL)
//   8  ...     types 2 and 3: the payload, zero-padded to a multiple of 8
//
// The operations return errno values (0 for success): 12 out of memory, 22 bad
// type, length or missing out-parameter, 34 out of range (an overflow, or an
// item outside the buffer), 45 growth of a buffer that may not grow. A failed
// operation leaves the current item where it was. Reads are in place: strings
// and bytes point into the buffer and stay valid until the handle is freed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>

namespace kestrel {

// How a buffer is released with its handle.
enum : std::uint32_t {
  kSBPackbuffDeallocNone = 0,  // the caller's
  kSBPackbuffDeallocFree = 1,  // heap memory; the only kind that grows
  kSBPackbuffDeallocVM = 2,    // a memory region of the process
};

enum : std::uint16_t {
  kSBPackbuffItemEnd = 0,
  kSBPackbuffItemUInt32 = 1,
  kSBPackbuffItemString = 2,
  kSBPackbuffItemBytes = 3,
};

inline constexpr std::size_t kSBPackbuffItemHeaderSize = 8;
inline constexpr std::size_t kSBPackbuffDefaultBlockSize = 256;

struct packbuff {
  std::uint32_t dealloc_type = kSBPackbuffDeallocNone;
  std::size_t block_size = 0;       // growth step; 0 for a wrapped buffer
  std::size_t bytes_allocated = 0;  // capacity
  std::size_t bytes_remaining = 0;  // bytes_allocated - bytes_used
  std::size_t bytes_used = 0;       // written so far, the end item included
  std::uint8_t* item_buffer = nullptr;
  // Writing: the end item, which the next item overwrites. Reading: the next item.
  std::uint8_t* item = nullptr;
};

// Releases the buffer by its dealloc_type, then the handle.
void sb_packbuff_free(packbuff* handle);

struct PackbuffFree {
  void operator()(packbuff* handle) const { sb_packbuff_free(handle); }
};
using PackbuffRef = std::unique_ptr<packbuff, PackbuffFree>;

// A growable heap buffer holding only the end item; blocks of blockSize bytes
// (256 when below 8). Nothing when memory runs out.
PackbuffRef sb_packbuff_new_with_tag(std::size_t blockSize);
PackbuffRef sb_packbuff_new(std::size_t blockSize);
// Wraps a buffer the caller made; it never grows. With hasContent it is ready
// to read (bytes_used = size); without, its first 8 bytes become the end item
// and it is ready to write. Nothing without a buffer, or when a buffer to write
// into cannot hold the end item.
PackbuffRef sb_packbuff_init_with_buffer_and_tag(void* buffer, std::size_t size, bool hasContent,
                                                 std::uint32_t deallocType);
PackbuffRef sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool hasContent,
                                         std::uint32_t deallocType);

std::uint8_t* sb_packbuff_get_bytes(const packbuff* handle);
std::size_t sb_packbuff_get_size(const packbuff* handle);
void sb_packbuff_set_size(packbuff* handle, std::size_t size);
// False at the end item (or where no whole item header is left in the
// buffer); otherwise the current item's value type and true.
bool sb_packbuff_get_item_value_type(const packbuff* handle, std::uint16_t* valueType);

int sb_packbuff_pack_uint32(packbuff* handle, std::uint16_t valueType, std::uint32_t value);
// 22 when length is all ones or string[length] is not NUL; the item holds
// length + 1 bytes, the NUL included.
int sb_packbuff_pack_string(packbuff* handle, std::uint16_t valueType, const char* string,
                            std::size_t length);
int sb_packbuff_pack_bytes(packbuff* handle, std::uint16_t valueType, const void* data,
                           std::size_t length);
// The key string, then the value string (lengths by strlen); stops at the first error.
int sb_packbuff_pack_key_with_string_value(packbuff* handle, std::uint16_t keyValueType,
                                           const char* key, std::uint16_t valueValueType,
                                           const char* value);

std::uint32_t sb_packbuff_unpack_uint32(packbuff* handle, int* error);
// The string inside the buffer; length excludes the NUL. 22 when the payload is
// empty or does not end with a NUL.
const char* sb_packbuff_unpack_string(packbuff* handle, std::size_t* length, int* error);
// The payload inside the buffer; length is written only on success.
const void* sb_packbuff_unpack_bytes(packbuff* handle, std::size_t* length, int* error);
// A key string and a value string; valueType gets the value item's value type.
int sb_packbuff_unpack_key_with_string_value(packbuff* handle, const char** key,
                                             std::uint16_t* valueType, const char** value,
                                             std::size_t* valueLength);

// A dump of the handle and every item, for debugging, on standard output.
void sb_packbuff_print(const packbuff* handle);

}  // namespace kestrel
