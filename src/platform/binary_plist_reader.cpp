#include "platform/binary_plist_reader.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <vector>

#include "platform/binary_plist_format.h"
#include "platform/plist_serialization.h"

namespace kestrel::platform {

namespace {

// Appends the UTF-8 form of `length` UTF-16 big-endian code units; false when
// they hold a lone surrogate.
bool appendUtf8OfUtf16(const std::uint8_t* units, std::uint64_t length, std::string& out) {
  out.reserve(out.size() + length * 3);
  for (std::uint64_t i = 0; i < length; ++i) {
    std::uint32_t cp = (std::uint32_t{units[2 * i]} << 8) | units[2 * i + 1];
    if (cp >= 0xD800 && cp <= 0xDFFF) {
      if (cp > 0xDBFF || i + 1 == length) return false;
      const std::uint32_t low = (std::uint32_t{units[2 * i + 2]} << 8) | units[2 * i + 3];
      if (low < 0xDC00 || low > 0xDFFF) return false;
      cp = 0x10000 + ((cp - 0xD800) << 10) + (low - 0xDC00);
      ++i;
    }
    if (cp < 0x80) {
      out.push_back(static_cast<char>(cp));
    } else if (cp < 0x800) {
      out.push_back(static_cast<char>(0xC0 | (cp >> 6)));
      out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else if (cp < 0x10000) {
      out.push_back(static_cast<char>(0xE0 | (cp >> 12)));
      out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else {
      out.push_back(static_cast<char>(0xF0 | (cp >> 18)));
      out.push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
      out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    }
  }
  return true;
}

// First the whole graph is walked without building anything (see checkGraph);
// only a graph that passes is turned into values, recursively: its depth is
// known to be bounded by then.
class BinaryPropertyListReader {
 public:
  explicit BinaryPropertyListReader(std::span<const std::uint8_t> bytes) : bytes_(bytes) {}

  std::optional<PlistValue> read(std::string* error) {
    if (!readTrailer(error) || !checkGraph(error)) return std::nullopt;
    return valueOf(topObject_, error);
  }

 private:
  struct Object {
    bool container = false;
    std::uint64_t refsStart = 0;
    std::uint64_t refCount = 0;
  };

  bool failWith(std::string* error, const char* reason) {
    if (error != nullptr) *error = reason;
    return false;
  }
  std::nullopt_t failValue(std::string* error, const char* reason) {
    failWith(error, reason);
    return std::nullopt;
  }

  bool readTrailer(std::string* error) {
    if (bytes_.size() < bplist::kMagic.size() + 1 + 1 + bplist::kTrailerSize) {
      return failWith(error, "binary property list is truncated");
    }
    const std::uint8_t* trailer = bytes_.data() + bytes_.size() - bplist::kTrailerSize;
    offsetSize_ = trailer[6];
    refSize_ = trailer[7];
    objectCount_ = bplist::readBigEndian(trailer + 8, 8);
    topObject_ = bplist::readBigEndian(trailer + 16, 8);
    const std::uint64_t tableOffset = bplist::readBigEndian(trailer + 24, 8);
    const std::uint64_t trailerOffset = bytes_.size() - bplist::kTrailerSize;
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) {
      return failWith(error, "binary property list has an invalid trailer");
    }
    if (objectCount_ == 0 || objectCount_ > kMaxPropertyListObjects) {
      return failWith(error, "binary property list has too many or no objects");
    }
    if (topObject_ >= objectCount_ || tableOffset <= bplist::kMagic.size() ||
        tableOffset > trailerOffset || objectCount_ > (trailerOffset - tableOffset) / offsetSize_) {
      return failWith(error, "binary property list has an invalid offset table");
    }
    objectsEnd_ = tableOffset;
    offsets_.resize(objectCount_);
    for (std::uint64_t i = 0; i < objectCount_; ++i) {
      const std::uint64_t offset =
          bplist::readBigEndian(bytes_.data() + tableOffset + i * offsetSize_, offsetSize_);
      if (offset < bplist::kMagic.size() || offset >= objectsEnd_) {
        return failWith(error, "binary property list has an object offset out of range");
      }
      offsets_[i] = offset;
    }
    return true;
  }

  // Reads an object's header: whether it holds references, and where they are.
  bool inspect(std::uint64_t ref, Object* object, std::string* error) {
    const std::uint64_t offset = offsets_[ref];
    const std::uint8_t marker = bytes_[offset];
    const std::uint8_t kind = marker >> 4;
    const std::uint8_t info = marker & 0x0F;
    *object = Object{};
    if (kind == (bplist::kMarkerInteger >> 4)) {
      if (info > 4) return failWith(error, "binary property list has an integer of unknown size");
      const std::uint64_t size = std::uint64_t{1} << info;
      if (objectsEnd_ - offset - 1 < size)
        return failWith(error, "binary property list is truncated");
      // Sixteen-byte integers carry values above INT64_MAX; anything wider does not fit.
      if (size == 16 && bplist::readBigEndian(bytes_.data() + offset + 1, 8) != 0) {
        return failWith(error, "binary property list has an integer out of range");
      }
      return true;
    }
    if (kind != bplist::kKindArray && kind != bplist::kKindOrderedSet && kind != bplist::kKindSet &&
        kind != bplist::kKindDictionary) {
      return true;  // A scalar; its payload is checked when it is read.
    }
    std::uint64_t count = 0;
    std::uint64_t refsStart = 0;
    if (!readCount(offset, &count, &refsStart, error)) return false;
    const std::uint64_t perEntry = kind == bplist::kKindDictionary ? 2 : 1;
    const std::uint64_t room = (objectsEnd_ - refsStart) / refSize_;
    if (count > room / perEntry) return failWith(error, "binary property list is truncated");
    object->container = true;
    object->refsStart = refsStart;
    object->refCount = count * perEntry;  // a dictionary's keys first, then its values
    return true;
  }

  // The number in the low nibble of the object's marker, or the integer object
  // that follows the marker when the nibble is 0xF; *start is where the
  // object's contents begin.
  bool readCount(std::uint64_t offset, std::uint64_t* count, std::uint64_t* start,
                 std::string* error) {
    const std::uint8_t info = bytes_[offset] & 0x0F;
    if (info != bplist::kCountFollows) {
      *count = info;
      *start = offset + 1;
      return true;
    }
    if (objectsEnd_ - offset < 2) return failWith(error, "binary property list is truncated");
    const std::uint8_t countMarker = bytes_[offset + 1];
    if ((countMarker & 0xF0) != bplist::kMarkerInteger || (countMarker & 0x0F) > 3) {
      return failWith(error, "binary property list has an invalid object count");
    }
    const std::uint64_t countSize = std::uint64_t{1} << (countMarker & 0x0F);
    if (objectsEnd_ - offset - 2 < countSize) {
      return failWith(error, "binary property list is truncated");
    }
    *count = bplist::readBigEndian(bytes_.data() + offset + 2, countSize);
    *start = offset + 2 + countSize;
    return true;
  }

  // The contents of a string or data object: *length characters of `unit`
  // bytes each from *start, all before the offset table.
  bool readRun(std::uint64_t offset, std::uint64_t unit, const std::uint8_t** start,
               std::uint64_t* length, std::string* error) {
    std::uint64_t begin = 0;
    if (!readCount(offset, length, &begin, error)) return false;
    if (*length > (objectsEnd_ - begin) / unit) {
      return failWith(error, "binary property list is truncated");
    }
    *start = bytes_.data() + begin;
    return true;
  }

  std::uint64_t refAt(const Object& object, std::uint64_t index) const {
    return bplist::readBigEndian(bytes_.data() + object.refsStart + index * refSize_, refSize_);
  }

  // Depth-first over the graph with an explicit stack. Each object is examined
  // once and remembers the height of the nesting below it and the number of
  // nodes it stands for once every shared subtree is copied out (an object
  // referenced twice is built twice), so that a graph which is small on disk
  // but huge as a tree is refused as well.
  bool checkGraph(std::string* error) {
    enum : std::uint8_t { kNew, kOnPath, kDone };
    struct Frame {
      std::uint64_t ref;
      Object object;
      std::uint64_t next = 0;
      std::uint16_t tallestChild = 0;
      std::uint64_t nodes = 1;
    };
    constexpr std::uint64_t kNodeLimit = kMaxPropertyListObjects;
    std::vector<std::uint8_t> state(objectCount_, kNew);
    std::vector<std::uint16_t> height(objectCount_, 0);
    std::vector<std::uint32_t> nodes(objectCount_, 1);
    std::vector<Frame> path;

    Object top;
    if (!inspect(topObject_, &top, error)) return false;
    if (!top.container) return true;
    path.push_back(Frame{topObject_, top});
    state[topObject_] = kOnPath;
    while (!path.empty()) {
      Frame& frame = path.back();
      if (frame.nodes > kNodeLimit) return failWith(error, "property list has too many objects");
      if (frame.next < frame.object.refCount) {
        const std::uint64_t child = refAt(frame.object, frame.next++);
        if (child >= objectCount_) {
          return failWith(error, "binary property list has a reference out of range");
        }
        if (state[child] == kOnPath) return failWith(error, "binary property list has a cycle");
        if (state[child] == kDone) {
          if (path.size() + height[child] > static_cast<std::size_t>(kMaxPropertyListDepth)) {
            return failWith(error, "property list is nested too deeply");
          }
          frame.tallestChild = std::max(frame.tallestChild, height[child]);
          frame.nodes += nodes[child];
          continue;
        }
        Object object;
        if (!inspect(child, &object, error)) return false;
        if (!object.container) {
          state[child] = kDone;
          frame.nodes += 1;
          continue;
        }
        if (path.size() + 1 > static_cast<std::size_t>(kMaxPropertyListDepth)) {
          return failWith(error, "property list is nested too deeply");
        }
        state[child] = kOnPath;
        path.push_back(Frame{child, object});
        continue;
      }
      const auto finishedHeight = static_cast<std::uint16_t>(frame.tallestChild + 1);
      const auto finishedNodes = static_cast<std::uint32_t>(frame.nodes);  // <= kNodeLimit
      state[frame.ref] = kDone;
      height[frame.ref] = finishedHeight;
      nodes[frame.ref] = finishedNodes;
      path.pop_back();
      if (!path.empty()) {
        path.back().tallestChild = std::max(path.back().tallestChild, finishedHeight);
        path.back().nodes += finishedNodes;
      }
    }
    return true;
  }

  // --- Values, once the graph is known to be sound ------------------------------------------

  // The payload of `size` bytes after the marker at `offset`, or nullptr when
  // the object runs into the offset table.
  const std::uint8_t* payload(std::uint64_t offset, std::uint64_t size) const {
    if (objectsEnd_ - offset - 1 < size) return nullptr;
    return bytes_.data() + offset + 1;
  }

  // A string object (ASCII or UTF-16) into *out; false with *error set otherwise.
  // A NUL character is refused: no path or name of ours holds one, and the
  // writer refuses them too.
  bool readString(std::uint64_t ref, std::string* out, std::string* error) {
    const std::uint64_t offset = offsets_[ref];
    const std::uint8_t kind = bytes_[offset] >> 4;
    if (kind != bplist::kKindAsciiString && kind != bplist::kKindUnicodeString) {
      return failWith(error, "property list dictionary key is not a string");
    }
    const std::uint8_t* characters = nullptr;
    std::uint64_t length = 0;
    const bool ascii = kind == bplist::kKindAsciiString;
    if (!readRun(offset, ascii ? 1 : 2, &characters, &length, error)) return false;
    if (ascii) {
      out->assign(reinterpret_cast<const char*>(characters), length);
    } else {
      out->clear();
      if (!appendUtf8OfUtf16(characters, length, *out)) {
        return failWith(error, "binary property list has a string that is not UTF-16");
      }
    }
    if (out->find('\0') != std::string::npos) {
      return failWith(error, "property list string holds a NUL character");
    }
    return true;
  }

  std::optional<PlistValue> valueOf(std::uint64_t ref, std::string* error) {
    const std::uint64_t offset = offsets_[ref];
    const std::uint8_t marker = bytes_[offset];
    const std::uint8_t info = marker & 0x0F;
    switch (marker >> 4) {
      case bplist::kKindSimple:
        if (marker == bplist::kMarkerFalse) return PlistValue(false);
        if (marker == bplist::kMarkerTrue) return PlistValue(true);
        break;
      case bplist::kKindInteger:
        return integerAt(offset, info);  // its size and range were checked with the graph
      case bplist::kKindReal: {
        const std::uint8_t* p = info == 2 || info == 3 ? payload(offset, 1u << info) : nullptr;
        if (p == nullptr) return failValue(error, "binary property list has an invalid real");
        if (info == 2) {
          return PlistValue(double{
              std::bit_cast<float>(static_cast<std::uint32_t>(bplist::readBigEndian(p, 4)))});
        }
        return PlistValue(std::bit_cast<double>(bplist::readBigEndian(p, 8)));
      }
      case bplist::kKindDate: {
        const std::uint8_t* p = marker == bplist::kMarkerDate ? payload(offset, 8) : nullptr;
        if (p == nullptr) return failValue(error, "binary property list has an invalid date");
        return PlistValue(PlistDate{std::bit_cast<double>(bplist::readBigEndian(p, 8))});
      }
      case bplist::kKindData: {
        const std::uint8_t* bytes = nullptr;
        std::uint64_t length = 0;
        if (!readRun(offset, 1, &bytes, &length, error)) return std::nullopt;
        return PlistValue(PlistData(bytes, bytes + length));
      }
      case bplist::kKindAsciiString:
      case bplist::kKindUnicodeString: {
        std::string text;
        if (!readString(ref, &text, error)) return std::nullopt;
        return PlistValue(std::move(text));
      }
      case bplist::kKindUid:
        return failValue(error, "property list holds a UID object, which is not supported");
      case bplist::kKindArray:
      case bplist::kKindOrderedSet:
      case bplist::kKindSet:
        return arrayAt(ref, error);
      case bplist::kKindDictionary:
        return dictionaryAt(ref, error);
      default:
        break;
    }
    return failValue(error, "property list holds an object of an unsupported type");
  }

  // One, two and four-byte integers are unsigned; eight bytes hold a signed
  // one; sixteen bytes (the high eight zero) the unsigned ones above INT64_MAX.
  PlistValue integerAt(std::uint64_t offset, std::uint8_t info) const {
    const std::uint8_t* p = bytes_.data() + offset + 1;
    if (info == 4) {
      const std::uint64_t low = bplist::readBigEndian(p + 8, 8);
      if (low <= bplist::kInt64Max) return PlistValue(static_cast<std::int64_t>(low));
      return PlistValue(low);
    }
    return PlistValue(static_cast<std::int64_t>(bplist::readBigEndian(p, std::size_t{1} << info)));
  }

  std::optional<PlistValue> arrayAt(std::uint64_t ref, std::string* error) {
    Object object;
    if (!inspect(ref, &object, error)) return std::nullopt;
    PlistArray array;
    array.reserve(object.refCount);
    for (std::uint64_t i = 0; i < object.refCount; ++i) {
      std::optional<PlistValue> item = valueOf(refAt(object, i), error);
      if (!item) return std::nullopt;
      array.push_back(std::move(*item));
    }
    return PlistValue(std::move(array));
  }

  // Keys first, then the values; of two equal keys the later one holds.
  std::optional<PlistValue> dictionaryAt(std::uint64_t ref, std::string* error) {
    Object object;
    if (!inspect(ref, &object, error)) return std::nullopt;
    const std::uint64_t count = object.refCount / 2;
    PlistDictionary dictionary;
    std::string key;
    for (std::uint64_t i = 0; i < count; ++i) {
      if (!readString(refAt(object, i), &key, error)) return std::nullopt;
      std::optional<PlistValue> item = valueOf(refAt(object, count + i), error);
      if (!item) return std::nullopt;
      dictionary.insert_or_assign(key, std::move(*item));
    }
    return PlistValue(std::move(dictionary));
  }

  std::span<const std::uint8_t> bytes_;
  std::uint8_t offsetSize_ = 0;
  std::uint8_t refSize_ = 0;
  std::uint64_t objectCount_ = 0;
  std::uint64_t topObject_ = 0;
  std::uint64_t objectsEnd_ = 0;
  std::vector<std::uint64_t> offsets_;
};

}  // namespace

std::optional<PlistValue> readBinaryPropertyList(std::span<const std::uint8_t> bytes,
                                                 std::string* error) {
  return BinaryPropertyListReader(bytes).read(error);
}

}  // namespace kestrel::platform
