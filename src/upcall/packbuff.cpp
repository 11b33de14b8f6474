#include "upcall/packbuff.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

#include "platform/memory_region.h"

namespace kestrel {

namespace {

constexpr std::size_t kHeader = kSBPackbuffItemHeaderSize;

std::size_t pad(std::size_t n) {
  return n % 8 == 0 ? 0 : 8 - n % 8;
}

// Fields are copied byte by byte: a wrapped buffer need not be aligned.
struct ItemHeader {
  std::uint16_t type = 0;
  std::uint16_t valueType = 0;
  std::uint32_t word = 0;  // the inline value, or the payload length
};

ItemHeader readHeader(const std::uint8_t* at) {
  ItemHeader header;
  std::memcpy(&header.type, at, 2);
  std::memcpy(&header.valueType, at + 2, 2);
  std::memcpy(&header.word, at + 4, 4);
  return header;
}

void writeHeader(std::uint8_t* at, const ItemHeader& header) {
  std::memcpy(at, &header.type, 2);
  std::memcpy(at + 2, &header.valueType, 2);
  std::memcpy(at + 4, &header.word, 4);
}

// The current item's offset from the start, when it lies inside the buffer.
bool itemOffset(const packbuff* handle, std::size_t* offset) {
  if (handle->item_buffer == nullptr || handle->item == nullptr) return false;
  const auto start = reinterpret_cast<std::uintptr_t>(handle->item_buffer);
  const auto at = reinterpret_cast<std::uintptr_t>(handle->item);
  if (at < start || at - start >= handle->bytes_allocated) return false;
  *offset = at - start;
  return true;
}

PackbuffRef newHandle() {
  try {
    return PackbuffRef(std::make_unique<packbuff>().release());
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}

void releaseBuffer(const packbuff& handle) {
  switch (handle.dealloc_type) {
    case kSBPackbuffDeallocFree:
      // NOLINTNEXTLINE(cppcoreguidelines-no-malloc,cppcoreguidelines-owning-memory)
      std::free(handle.item_buffer);
      break;
    case kSBPackbuffDeallocVM:
      if (platform::releaseMemoryRegion(handle.item_buffer, handle.bytes_allocated) != 0) {
        std::printf("failed: vm_deallocate(%p, %zu)\n", static_cast<void*>(handle.item_buffer),
                    handle.bytes_allocated);
      }
      break;
    default:
      break;
  }
}

// A growable buffer is heap memory that the handle owns and releases with
// free(): a caller may also hand one over (dealloc type 1), so it is malloc'd.

// Makes room for an item of `needed` bytes. A failed reallocation releases the
// old buffer; the handle then starts again from nothing on its next growth.
int grow(packbuff* handle, std::size_t needed) {
  if (handle->block_size == 0 || handle->dealloc_type != kSBPackbuffDeallocFree) return ENOTSUP;
  std::size_t allocated = 0;
  if (__builtin_add_overflow(handle->bytes_allocated, handle->block_size, &allocated)) {
    return ENOMEM;
  }
  std::size_t rounded = 0;
  if (__builtin_add_overflow(needed, pad(needed), &rounded)) return ENOMEM;
  if (rounded > allocated - handle->bytes_used &&
      __builtin_add_overflow(allocated, rounded, &allocated)) {
    return ENOMEM;
  }
  // NOLINTNEXTLINE(cppcoreguidelines-no-malloc,cppcoreguidelines-owning-memory)
  void* bigger = std::realloc(handle->item_buffer, allocated);
  if (bigger == nullptr) {
    // NOLINTNEXTLINE(cppcoreguidelines-no-malloc,cppcoreguidelines-owning-memory)
    std::free(handle->item_buffer);
    handle->item_buffer = nullptr;
    handle->item = nullptr;
    handle->bytes_allocated = handle->bytes_used = handle->bytes_remaining = 0;
    return ENOMEM;
  }
  handle->item_buffer = static_cast<std::uint8_t*>(bigger);
  handle->bytes_allocated = allocated;
  if (handle->bytes_used == 0) {
    std::memset(handle->item_buffer, 0, kHeader);
    handle->bytes_used = kHeader;
  }
  handle->bytes_remaining = allocated - handle->bytes_used;
  handle->item = handle->item_buffer + handle->bytes_used - kHeader;
  return 0;
}

int writeItem(packbuff* handle, std::uint16_t type, std::uint16_t valueType,
              std::uint32_t inlineValue, const void* payload, std::size_t length) {
  if (handle == nullptr) return EINVAL;
  const bool carriesPayload = type == kSBPackbuffItemString || type == kSBPackbuffItemBytes;
  if (type != kSBPackbuffItemUInt32 && !carriesPayload) return EINVAL;
  if (carriesPayload != (payload != nullptr)) return EINVAL;
  if (carriesPayload && length > std::numeric_limits<std::uint32_t>::max()) return ERANGE;

  std::size_t extra = 0;
  if (carriesPayload && __builtin_add_overflow(length, pad(length), &extra)) return ERANGE;
  std::size_t needed = 0;
  if (__builtin_add_overflow(extra, kHeader, &needed)) return ERANGE;
  while (needed > handle->bytes_remaining) {
    if (const int error = grow(handle, needed); error != 0) return error;
  }
  // The item and the end item after it must lie inside the buffer, whatever
  // set_size did to the counts.
  std::size_t offset = 0;
  if (!itemOffset(handle, &offset) || handle->bytes_allocated - offset < needed + kHeader) {
    return ERANGE;
  }

  std::uint8_t* at = handle->item;
  if (carriesPayload) {
    writeHeader(at, {type, valueType, static_cast<std::uint32_t>(length)});
    std::memcpy(at + kHeader, payload, length);
    std::memset(at + kHeader + length, 0, pad(length));
  } else {
    writeHeader(at, {type, valueType, inlineValue});
  }
  handle->item += needed;
  handle->bytes_remaining -= needed;
  handle->bytes_used += needed;
  std::memset(handle->item, 0, kHeader);
  return 0;
}

// Reads the current item as `expected` without moving on; `size` is its whole size.
int peekItem(const packbuff* handle, std::uint16_t expected, std::uint32_t* value,
             const std::uint8_t** payload, std::uint32_t* length, std::size_t* size) {
  if (handle == nullptr) return EINVAL;
  std::size_t offset = 0;
  if (!itemOffset(handle, &offset) || handle->bytes_allocated - offset < kHeader) return ERANGE;
  const ItemHeader header = readHeader(handle->item);
  if (header.type != expected) return EINVAL;
  switch (expected) {
    case kSBPackbuffItemUInt32:
      if (value == nullptr) return EINVAL;
      *size = kHeader;
      break;
    case kSBPackbuffItemString:
    case kSBPackbuffItemBytes:
      if (payload == nullptr || length == nullptr) return EINVAL;
      *size = kHeader + header.word + pad(header.word);
      break;
    default:
      return EINVAL;
  }
  // The next item must lie inside the buffer too.
  if (*size >= handle->bytes_allocated - offset) return ERANGE;
  if (value != nullptr) *value = header.word;
  if (payload != nullptr) *payload = handle->item + kHeader;
  if (length != nullptr) *length = header.word;
  return 0;
}

void setError(int* error, int value) {
  if (error != nullptr) *error = value;
}

const char* kDeallocNames[] = {"None", "free()", "vm_deallocate()"};

}  // namespace

void sb_packbuff_free(packbuff* handle) {
  if (handle == nullptr) return;
  const std::unique_ptr<packbuff> owned(handle);
  releaseBuffer(*owned);
}

PackbuffRef sb_packbuff_new_with_tag(std::size_t blockSize) {
  PackbuffRef handle = newHandle();
  if (!handle) return nullptr;
  handle->block_size = blockSize < kHeader ? kSBPackbuffDefaultBlockSize : blockSize;
  // NOLINTNEXTLINE(cppcoreguidelines-no-malloc,cppcoreguidelines-owning-memory)
  handle->item_buffer = static_cast<std::uint8_t*>(std::malloc(handle->block_size));
  if (handle->item_buffer == nullptr) return nullptr;
  handle->dealloc_type = kSBPackbuffDeallocFree;
  handle->bytes_allocated = handle->block_size;
  std::memset(handle->item_buffer, 0, kHeader);
  handle->bytes_used = kHeader;
  handle->bytes_remaining = handle->bytes_allocated - kHeader;
  handle->item = handle->item_buffer;
  return handle;
}

PackbuffRef sb_packbuff_new(std::size_t blockSize) {
  return sb_packbuff_new_with_tag(blockSize);
}

PackbuffRef sb_packbuff_init_with_buffer_and_tag(void* buffer, std::size_t size, bool hasContent,
                                                 std::uint32_t deallocType) {
  if (buffer == nullptr || (!hasContent && size < kHeader)) return nullptr;
  PackbuffRef handle = newHandle();
  if (!handle) return nullptr;
  handle->dealloc_type = deallocType;
  handle->block_size = 0;
  handle->bytes_allocated = size;
  handle->item_buffer = static_cast<std::uint8_t*>(buffer);
  handle->item = handle->item_buffer;
  if (hasContent) {
    handle->bytes_used = size;
  } else {
    std::memset(buffer, 0, kHeader);
    handle->bytes_used = kHeader;
  }
  handle->bytes_remaining = size - handle->bytes_used;
  return handle;
}

PackbuffRef sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool hasContent,
                                         std::uint32_t deallocType) {
  return sb_packbuff_init_with_buffer_and_tag(buffer, size, hasContent, deallocType);
}

std::uint8_t* sb_packbuff_get_bytes(const packbuff* handle) {
  return handle->item_buffer;
}

std::size_t sb_packbuff_get_size(const packbuff* handle) {
  return handle->bytes_used;
}

void sb_packbuff_set_size(packbuff* handle, std::size_t size) {
  handle->bytes_used = size;
  handle->bytes_remaining = handle->bytes_allocated - size;
}

bool sb_packbuff_get_item_value_type(const packbuff* handle, std::uint16_t* valueType) {
  std::size_t offset = 0;
  if (handle == nullptr || !itemOffset(handle, &offset) ||
      handle->bytes_allocated - offset < kHeader) {
    return false;
  }
  const ItemHeader header = readHeader(handle->item);
  if (header.type == kSBPackbuffItemEnd) return false;
  if (valueType != nullptr) *valueType = header.valueType;
  return true;
}

int sb_packbuff_pack_uint32(packbuff* handle, std::uint16_t valueType, std::uint32_t value) {
  return writeItem(handle, kSBPackbuffItemUInt32, valueType, value, nullptr, 0);
}

int sb_packbuff_pack_string(packbuff* handle, std::uint16_t valueType, const char* string,
                            std::size_t length) {
  if (string == nullptr || length == std::numeric_limits<std::size_t>::max() ||
      string[length] != '\0') {
    return EINVAL;
  }
  return writeItem(handle, kSBPackbuffItemString, valueType, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(packbuff* handle, std::uint16_t valueType, const void* data,
                           std::size_t length) {
  return writeItem(handle, kSBPackbuffItemBytes, valueType, 0, data, length);
}

int sb_packbuff_pack_key_with_string_value(packbuff* handle, std::uint16_t keyValueType,
                                           const char* key, std::uint16_t valueValueType,
                                           const char* value) {
  if (key == nullptr || value == nullptr) return EINVAL;
  if (const int error = sb_packbuff_pack_string(handle, keyValueType, key, std::strlen(key))) {
    return error;
  }
  return sb_packbuff_pack_string(handle, valueValueType, value, std::strlen(value));
}

std::uint32_t sb_packbuff_unpack_uint32(packbuff* handle, int* error) {
  std::uint32_t value = 0;
  std::size_t size = 0;
  const int result = peekItem(handle, kSBPackbuffItemUInt32, &value, nullptr, nullptr, &size);
  setError(error, result);
  if (result != 0) return 0;
  handle->item += size;
  return value;
}

const char* sb_packbuff_unpack_string(packbuff* handle, std::size_t* length, int* error) {
  const std::uint8_t* payload = nullptr;
  std::uint32_t payloadLength = 0;
  std::size_t size = 0;
  int result = peekItem(handle, kSBPackbuffItemString, nullptr, &payload, &payloadLength, &size);
  if (result == 0 && (payloadLength == 0 || payload[payloadLength - 1] != '\0')) result = EINVAL;
  setError(error, result);
  if (result != 0) return nullptr;
  handle->item += size;
  if (length != nullptr) *length = payloadLength - 1;
  return reinterpret_cast<const char*>(payload);
}

const void* sb_packbuff_unpack_bytes(packbuff* handle, std::size_t* length, int* error) {
  const std::uint8_t* payload = nullptr;
  std::uint32_t payloadLength = 0;
  std::size_t size = 0;
  const int result =
      peekItem(handle, kSBPackbuffItemBytes, nullptr, &payload, &payloadLength, &size);
  setError(error, result);
  if (result != 0) return nullptr;
  handle->item += size;
  if (length != nullptr) *length = payloadLength;
  return payload;
}

int sb_packbuff_unpack_key_with_string_value(packbuff* handle, const char** key,
                                             std::uint16_t* valueType, const char** value,
                                             std::size_t* valueLength) {
  if (handle == nullptr) return EINVAL;
  std::uint8_t* const start = handle->item;
  int error = 0;
  const char* keyString = sb_packbuff_unpack_string(handle, nullptr, &error);
  if (error != 0) return error;
  std::uint16_t type = 0;
  if (valueType != nullptr && sb_packbuff_get_item_value_type(handle, &type)) *valueType = type;
  std::size_t length = 0;
  const char* valueString = sb_packbuff_unpack_string(handle, &length, &error);
  if (error != 0) {
    handle->item = start;
    return error;
  }
  if (key != nullptr) *key = keyString;
  if (value != nullptr) *value = valueString;
  if (valueLength != nullptr) *valueLength = length;
  return 0;
}

void sb_packbuff_print(const packbuff* handle) {
  std::printf("packbuff: %p\n", static_cast<const void*>(handle));
  std::printf("  block_size:      %zu\n", handle->block_size);
  std::printf("  dealloc_type:    %s\n", handle->dealloc_type <= kSBPackbuffDeallocVM
                                             ? kDeallocNames[handle->dealloc_type]
                                             : "<Unknown>");
  std::printf("  bytes_allocated: %zu\n", handle->bytes_allocated);
  std::printf("  bytes_used:      %zu\n", handle->bytes_used);
  std::printf("  bytes_remaining: %zu\n", handle->bytes_remaining);
  std::printf("  item_buffer %p, item: %p\n", static_cast<void*>(handle->item_buffer),
              static_cast<void*>(handle->item));
  std::printf("\n");

  // Offsets rather than pointers, so that nothing beyond the buffer is ever formed.
  const std::size_t used = handle->item_buffer == nullptr                 ? 0
                           : handle->bytes_used < handle->bytes_allocated ? handle->bytes_used
                                                                          : handle->bytes_allocated;
  std::size_t offset = 0;
  int index = 0;
  for (;; ++index) {
    std::uint8_t* at = handle->item_buffer + offset;
    const char* marker = at == handle->item ? "*" : " ";
    if (used - offset < kHeader) {
      std::printf(">> item pointer exceeds end of buffer. <<\n");
      return;
    }
    const ItemHeader header = readHeader(at);
    if (header.type == kSBPackbuffItemEnd) {
      std::printf("%s%3d: %p -- END\n", marker, index, static_cast<void*>(at));
      return;
    }
    std::printf("%s%3d:%p -- value type %u --", marker, index, static_cast<void*>(at),
                static_cast<unsigned>(header.valueType));
    std::size_t size = kHeader;
    const auto padding = static_cast<unsigned>(pad(header.word));
    void* payload = at + kHeader;
    switch (header.type) {
      case kSBPackbuffItemBytes:
        std::printf("bytes (%p, %u pad bytes, size: %u)\n", payload, padding, header.word);
        size += header.word + padding;
        break;
      case kSBPackbuffItemString: {
        // Printed only as far as it lies inside the buffer.
        const std::size_t room = used - offset - kHeader;
        const std::size_t shown = header.word < room ? header.word : room;
        std::printf("string (%p, %u pad bytes, size: %u): \n     `%.*s'\n", payload, padding,
                    header.word, static_cast<int>(strnlen(static_cast<char*>(payload), shown)),
                    static_cast<char*>(payload));
        size += header.word + padding;
        break;
      }
      case kSBPackbuffItemUInt32:
        std::printf("inline value: %u\n", header.word);
        break;
      default:
        std::printf("*Unknown item type* %u\n", static_cast<unsigned>(header.type));
        break;
    }
    if (size > used - offset) {
      std::printf(">> item pointer exceeds end of buffer. <<\n");
      return;
    }
    offset += size;
  }
}

}  // namespace kestrel
