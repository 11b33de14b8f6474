#include "platform/plist_serialization.h"

#include <plist/plist.h>

#include <algorithm>
#include <bit>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <string_view>

#include "platform/binary_plist_format.h"
#include "platform/binary_plist_reader.h"

namespace kestrel::platform {

namespace {

using bplist::appendBigEndian;
using bplist::kInt64Max;
using bplist::kMarkerDate;
using bplist::kMarkerInteger16Bytes;
using bplist::kTrailerSize;
using bplist::readBigEndian;
constexpr std::string_view kBinaryMagic = bplist::kMagic;

// --- Ownership of what libplist hands out -------------------------------------------------

struct PlistDeleter {
  void operator()(void* node) const { plist_free(static_cast<plist_t>(node)); }
};
using UniquePlist = std::unique_ptr<void, PlistDeleter>;

struct BinaryBufferDeleter {
  void operator()(char* buffer) const { plist_to_bin_free(buffer); }
};
using BinaryBuffer = std::unique_ptr<char, BinaryBufferDeleter>;

// Dictionary keys and iterators come from malloc.
struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};
using MallocBuffer = std::unique_ptr<char, FreeDeleter>;
using DictionaryIterator = std::unique_ptr<void, FreeDeleter>;

template <typename T>
std::optional<T> fail(std::string* error, std::string reason) {
  if (error != nullptr) *error = std::move(reason);
  return std::nullopt;
}

bool isValidUtf8(std::string_view s) {
  std::size_t i = 0;
  while (i < s.size()) {
    const auto c = static_cast<unsigned char>(s[i]);
    if (c == 0) return false;
    if (c < 0x80) {
      ++i;
      continue;
    }
    std::size_t length = 0;
    std::uint32_t cp = 0;
    if ((c & 0xE0) == 0xC0) {
      length = 2;
      cp = c & 0x1F;
    } else if ((c & 0xF0) == 0xE0) {
      length = 3;
      cp = c & 0x0F;
    } else if ((c & 0xF8) == 0xF0) {
      length = 4;
      cp = c & 0x07;
    } else {
      return false;
    }
    if (s.size() - i < length) return false;
    for (std::size_t k = 1; k < length; ++k) {
      const auto cc = static_cast<unsigned char>(s[i + k]);
      if ((cc & 0xC0) != 0x80) return false;
      cp = (cp << 6) | (cc & 0x3F);
    }
    const std::uint32_t minimum = length == 2 ? 0x80 : length == 3 ? 0x800 : 0x10000;
    if (cp < minimum || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
    i += length;
  }
  return true;
}

// --- Checks made before libplist sees XML ------------------------------------------------

// Counts the nesting of <array> and <dict> elements and the number of elements
// of an XML property list. It errs on the side of counting too much: an array
// or dictionary tag counts as empty only in its plain "<array/>" form.
bool checkXmlStructure(std::string_view text, std::string* error) {
  auto failWith = [&](const char* reason) {
    if (error != nullptr) *error = reason;
    return false;
  };
  auto skipPast = [&](std::size_t from, std::string_view terminator) {
    const std::size_t end = text.find(terminator, from);
    return end == std::string_view::npos ? end : end + terminator.size();
  };
  int depth = 0;
  std::size_t elements = 0;
  std::size_t i = 0;
  while ((i = text.find('<', i)) != std::string_view::npos) {
    const std::string_view rest = text.substr(i);
    if (rest.starts_with("<!--")) {
      i = skipPast(i + 4, "-->");
    } else if (rest.starts_with("<![CDATA[")) {
      i = skipPast(i + 9, "]]>");
    } else if (rest.starts_with("<?")) {
      i = skipPast(i + 2, "?>");
    } else if (rest.starts_with("<!")) {
      i = skipPast(i + 2, ">");
    } else {
      const bool closing = rest.starts_with("</");
      const std::size_t nameStart = i + (closing ? 2 : 1);
      std::size_t nameEnd = nameStart;
      while (nameEnd < text.size() &&
             std::string_view(" \t\r\n/>").find(text[nameEnd]) == std::string_view::npos) {
        ++nameEnd;
      }
      const std::string_view name = text.substr(nameStart, nameEnd - nameStart);
      const std::size_t tagEnd = text.find('>', nameEnd);
      if (tagEnd == std::string_view::npos) return failWith("XML property list is truncated");
      if (name == "array" || name == "dict") {
        std::string_view tail = text.substr(nameEnd, tagEnd - nameEnd);
        while (!tail.empty() &&
               std::string_view(" \t\r\n").find(tail.front()) != std::string_view::npos) {
          tail.remove_prefix(1);
        }
        if (closing) {
          if (depth > 0) --depth;
        } else if (tail != "/" && ++depth > kMaxPropertyListDepth) {
          return failWith("property list is nested too deeply");
        }
      }
      if (!closing && ++elements > 2 * kMaxPropertyListObjects) {
        return failWith("property list has too many objects");
      }
      i = tagEnd + 1;
    }
    if (i == std::string_view::npos) return failWith("XML property list is truncated");
  }
  return true;
}

// --- Facts libplist's accessors do not give ------------------------------------------------
//
// libplist keeps whether an integer was stored in sixteen bytes (the unsigned
// values above INT64_MAX) and a date's exact seconds, but its accessors give
// only the low 64 bits and whole microseconds. Its binary writer and reader
// keep both, so a single scalar is encoded or decoded as a one-object binary
// property list: "bplist00", the object, a one-byte offset table, the trailer.

UniquePlist nodeFromBinaryObject(const std::vector<std::uint8_t>& object) {
  std::vector<std::uint8_t> bytes(kBinaryMagic.begin(), kBinaryMagic.end());
  bytes.insert(bytes.end(), object.begin(), object.end());
  const std::uint64_t tableOffset = bytes.size();
  bytes.push_back(static_cast<std::uint8_t>(kBinaryMagic.size()));  // offset of object 0
  bytes.insert(bytes.end(), 6, 0);
  bytes.push_back(1);            // offset size
  bytes.push_back(1);            // reference size
  appendBigEndian(bytes, 1, 8);  // one object
  appendBigEndian(bytes, 0, 8);  // the top object
  appendBigEndian(bytes, tableOffset, 8);
  plist_t node = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(bytes.data()),
                 static_cast<std::uint32_t>(bytes.size()), &node);
  return UniquePlist(node);
}

// The encoded object of a scalar node (marker byte first); empty on failure.
std::vector<std::uint8_t> binaryObjectOfNode(plist_t node) {
  char* raw = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(node, &raw, &length);
  const BinaryBuffer buffer(raw);
  if (raw == nullptr || length < kBinaryMagic.size() + 1 + 1 + kTrailerSize) return {};
  const auto* begin = reinterpret_cast<const std::uint8_t*>(raw) + kBinaryMagic.size();
  const auto* end = reinterpret_cast<const std::uint8_t*>(raw) + length - kTrailerSize - 1;
  return std::vector<std::uint8_t>(begin, end);
}

// --- libplist nodes to values ----------------------------------------------------------------

std::optional<PlistValue> valueFromNode(plist_t node, int depth, std::string* error);

std::optional<PlistValue> integerFromNode(plist_t node, std::string* error) {
  std::uint64_t bits = 0;
  plist_get_uint_val(node, &bits);
  if (bits <= kInt64Max) return PlistValue(static_cast<std::int64_t>(bits));
  // Either a negative number (eight bytes) or an unsigned one above INT64_MAX (sixteen).
  const std::vector<std::uint8_t> object = binaryObjectOfNode(node);
  if (object.empty()) return fail<PlistValue>(error, "cannot read an integer of the property list");
  if (object[0] == kMarkerInteger16Bytes) return PlistValue(bits);
  return PlistValue(static_cast<std::int64_t>(bits));
}

std::optional<PlistValue> dateFromNode(plist_t node, std::string* error) {
  const std::vector<std::uint8_t> object = binaryObjectOfNode(node);
  if (object.size() < 9 || object[0] != kMarkerDate) {
    return fail<PlistValue>(error, "cannot read a date of the property list");
  }
  const double seconds = std::bit_cast<double>(readBigEndian(object.data() + 1, 8));
  return PlistValue(PlistDate{seconds});
}

// depth: the nesting level of this array or dictionary, the top level being 1.
std::optional<PlistValue> arrayFromNode(plist_t node, int depth, std::string* error) {
  if (depth > kMaxPropertyListDepth) {
    return fail<PlistValue>(error, "property list is nested too deeply");
  }
  PlistArray array;
  const std::uint32_t size = plist_array_get_size(node);
  array.reserve(size);
  for (std::uint32_t i = 0; i < size; ++i) {
    plist_t item = plist_array_get_item(node, i);
    if (item == nullptr) return fail<PlistValue>(error, "property list array is damaged");
    std::optional<PlistValue> value = valueFromNode(item, depth + 1, error);
    if (!value) return std::nullopt;
    array.push_back(std::move(*value));
  }
  return PlistValue(std::move(array));
}

std::optional<PlistValue> dictionaryFromNode(plist_t node, int depth, std::string* error) {
  if (depth > kMaxPropertyListDepth) {
    return fail<PlistValue>(error, "property list is nested too deeply");
  }
  PlistDictionary dictionary;
  plist_dict_iter rawIterator = nullptr;
  plist_dict_new_iter(node, &rawIterator);
  const DictionaryIterator iterator(rawIterator);
  if (rawIterator == nullptr)
    return fail<PlistValue>(error, "out of memory reading a property list");
  for (;;) {
    char* rawKey = nullptr;
    plist_t item = nullptr;
    plist_dict_next_item(node, rawIterator, &rawKey, &item);
    const MallocBuffer key(rawKey);
    if (item == nullptr) break;
    if (rawKey == nullptr) return fail<PlistValue>(error, "property list dictionary is damaged");
    std::optional<PlistValue> value = valueFromNode(item, depth + 1, error);
    if (!value) return std::nullopt;
    dictionary.insert_or_assign(std::string(rawKey), std::move(*value));
  }
  return PlistValue(std::move(dictionary));
}

std::optional<PlistValue> valueFromNode(plist_t node, int depth, std::string* error) {
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      std::uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return PlistValue(b != 0);
    }
    case PLIST_UINT:
      return integerFromNode(node, error);
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return PlistValue(d);
    }
    case PLIST_STRING: {
      std::uint64_t length = 0;
      const char* p = plist_get_string_ptr(node, &length);
      return PlistValue(p == nullptr ? std::string() : std::string(p, length));
    }
    case PLIST_DATA: {
      std::uint64_t length = 0;
      const char* p = plist_get_data_ptr(node, &length);
      const auto* bytes = reinterpret_cast<const std::uint8_t*>(p);
      return PlistValue(p == nullptr ? PlistData() : PlistData(bytes, bytes + length));
    }
    case PLIST_DATE:
      return dateFromNode(node, error);
    case PLIST_ARRAY:
      return arrayFromNode(node, depth, error);
    case PLIST_DICT:
      return dictionaryFromNode(node, depth, error);
    case PLIST_UID:
      return fail<PlistValue>(error, "property list holds a UID object, which is not supported");
    default:
      return fail<PlistValue>(error, "property list holds an object of an unsupported type");
  }
}

// --- Values to libplist nodes ----------------------------------------------------------------

UniquePlist nodeFromValue(const PlistValue& value, int depth, std::string* error);

bool checkString(std::string_view s, std::string* error) {
  if (isValidUtf8(s)) return true;
  if (error != nullptr) {
    *error = "property list string is not UTF-8 or holds a NUL byte";
  }
  return false;
}

// depth: the nesting level the value would have, the top level being 1.
UniquePlist nodeFromValue(const PlistValue& value, int depth, std::string* error) {
  if ((value.isDictionary() || value.isArray()) && depth > kMaxPropertyListDepth) {
    if (error != nullptr) *error = "property list is nested too deeply";
    return nullptr;
  }
  UniquePlist node;
  switch (value.type()) {
    case PlistValue::Type::Dictionary: {
      node.reset(plist_new_dict());
      if (!node) break;
      for (const auto& [key, item] : *value.dictionary()) {
        if (!checkString(key, error)) return nullptr;
        UniquePlist child = nodeFromValue(item, depth + 1, error);
        if (!child) return nullptr;
        plist_dict_set_item(node.get(), key.c_str(), child.release());
      }
      return node;
    }
    case PlistValue::Type::Array: {
      node.reset(plist_new_array());
      if (!node) break;
      for (const PlistValue& item : *value.array()) {
        UniquePlist child = nodeFromValue(item, depth + 1, error);
        if (!child) return nullptr;
        plist_array_append_item(node.get(), child.release());
      }
      return node;
    }
    case PlistValue::Type::String:
      if (!checkString(*value.string(), error)) return nullptr;
      node.reset(plist_new_string(value.string()->c_str()));
      break;
    case PlistValue::Type::Integer:
      // Negative values are stored as their eight-byte two's complement.
      node.reset(plist_new_uint(static_cast<std::uint64_t>(*value.signedInteger())));
      break;
    case PlistValue::Type::UnsignedInteger: {
      const std::uint64_t u = *value.unsignedInteger();
      if (u <= kInt64Max) {
        node.reset(plist_new_uint(u));
      } else {
        std::vector<std::uint8_t> object{kMarkerInteger16Bytes};
        appendBigEndian(object, 0, 8);
        appendBigEndian(object, u, 8);
        node = nodeFromBinaryObject(object);
      }
      break;
    }
    case PlistValue::Type::Real:
      node.reset(plist_new_real(*value.real()));
      break;
    case PlistValue::Type::Boolean:
      node.reset(plist_new_bool(*value.boolean() ? 1 : 0));
      break;
    case PlistValue::Type::Data: {
      static const char kEmpty[1] = {};
      const PlistData& data = *value.data();
      const char* bytes = data.empty() ? kEmpty : reinterpret_cast<const char*>(data.data());
      node.reset(plist_new_data(bytes, data.size()));
      break;
    }
    case PlistValue::Type::Date: {
      std::vector<std::uint8_t> object{kMarkerDate};
      appendBigEndian(object, std::bit_cast<std::uint64_t>(value.date()->secondsSinceReferenceDate),
                      8);
      node = nodeFromBinaryObject(object);
      break;
    }
  }
  if (!node && error != nullptr) *error = "cannot build a property list node";
  return node;
}

}  // namespace

std::optional<PlistValue> parsePropertyList(std::span<const std::uint8_t> bytes,
                                            std::string* error) {
  if (bytes.empty()) return fail<PlistValue>(error, "property list is empty");
  if (bytes.size() > kMaxPropertyListSize) {
    return fail<PlistValue>(error, "property list is too large");
  }
  const char* raw = reinterpret_cast<const char*>(bytes.data());
  const auto length = static_cast<std::uint32_t>(bytes.size());
  if (bytes.size() >= kBinaryMagic.size() &&
      std::memcmp(raw, kBinaryMagic.data(), kBinaryMagic.size()) == 0) {
    return readBinaryPropertyList(bytes, error);
  }
  if (!checkXmlStructure(std::string_view(raw, bytes.size()), error)) return std::nullopt;
  plist_t root = nullptr;
  plist_from_xml(raw, length, &root);
  const UniquePlist owner(root);
  if (root == nullptr)
    return fail<PlistValue>(error, "data is not a property list libplist can read");
  return valueFromNode(root, 1, error);
}

std::optional<std::vector<std::uint8_t>> serializeBinaryPropertyList(const PlistValue& value,
                                                                     std::string* error) {
  const UniquePlist root = nodeFromValue(value, 1, error);
  if (!root) return std::nullopt;
  char* raw = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(root.get(), &raw, &length);
  const BinaryBuffer buffer(raw);
  if (raw == nullptr || length == 0) {
    return fail<std::vector<std::uint8_t>>(error, "libplist could not serialise the value");
  }
  if (length > kMaxPropertyListSize) {
    return fail<std::vector<std::uint8_t>>(error, "property list is too large");
  }
  const auto* begin = reinterpret_cast<const std::uint8_t*>(raw);
  return std::vector<std::uint8_t>(begin, begin + length);
}

}  // namespace kestrel::platform
