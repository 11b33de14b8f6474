#include "platform/plist_serialization.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <vector>

namespace kestrel::platform {
namespace {

using Bytes = std::vector<std::uint8_t>;

Bytes bytesOf(std::string_view text) {
  return Bytes(text.begin(), text.end());
}

void appendBigEndian(Bytes& out, std::uint64_t value, int size) {
  for (int i = size - 1; i >= 0; --i) out.push_back(static_cast<std::uint8_t>(value >> (8 * i)));
}

// A binary property list made of the given encoded objects (references two bytes wide).
Bytes binaryPlist(const std::vector<Bytes>& objects, std::uint64_t top = 0) {
  Bytes out = bytesOf("bplist00");
  std::vector<std::uint64_t> offsets;
  for (const Bytes& object : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), object.begin(), object.end());
  }
  const std::uint64_t table = out.size();
  for (std::uint64_t offset : offsets) appendBigEndian(out, offset, 4);
  out.insert(out.end(), 6, 0);
  out.push_back(4);  // offset size
  out.push_back(2);  // reference size
  appendBigEndian(out, objects.size(), 8);
  appendBigEndian(out, top, 8);
  appendBigEndian(out, table, 8);
  return out;
}

// Object i is an array holding `fanOut` references to object i + 1; the last is an empty array.
Bytes nestedArrays(int levels, int fanOut) {
  std::vector<Bytes> objects;
  for (int i = 0; i < levels - 1; ++i) {
    Bytes object{static_cast<std::uint8_t>(0xA0 | fanOut)};
    for (int k = 0; k < fanOut; ++k) appendBigEndian(object, static_cast<std::uint64_t>(i + 1), 2);
    objects.push_back(object);
  }
  objects.push_back(Bytes{0xA0});
  return binaryPlist(objects);
}

std::string nestedXml(int levels) {
  std::string xml = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
  for (int i = 0; i < levels; ++i) xml += "<array>";
  for (int i = 0; i < levels; ++i) xml += "</array>";
  return xml + "</plist>";
}

PlistValue everyKind() {
  return PlistDictionary{
      {"string", "plain"},
      {"unicode", "caf\xC3\xA9 \xF0\x9F\x98\x80"},
      {"negative", std::int64_t{-42}},
      {"int-min", std::numeric_limits<std::int64_t>::min()},
      {"int-max", std::numeric_limits<std::int64_t>::max()},
      {"uint-above-int", std::uint64_t{9223372036854775808ull}},
      {"uint-max", std::numeric_limits<std::uint64_t>::max()},
      {"real", -0.1},
      {"yes", true},
      {"data", PlistData{0, 1, 0xFF, 0}},
      {"date", PlistDate{-0.25}},
      {"precise-date", PlistDate{730000000.123456789}},
      {"nested", PlistArray{PlistDictionary{{"inner", PlistArray{1, "two", PlistArray{}}}},
                            PlistDictionary{}}},
  };
}

TEST(PlistSerializationTest, EveryKindOfValueSurvivesARoundTrip) {
  std::string error;
  const auto bytes = serializeBinaryPropertyList(everyKind(), &error);
  ASSERT_TRUE(bytes) << error;
  ASSERT_GE(bytes->size(), 8u);
  EXPECT_EQ(std::string(bytes->begin(), bytes->begin() + 8), "bplist00");
  const auto back = parsePropertyList(*bytes, &error);
  ASSERT_TRUE(back) << error;
  EXPECT_EQ(*back, everyKind()) << back->description();

  // The format keeps no sign for small numbers: they come back signed.
  const auto small = serializeBinaryPropertyList(PlistArray{std::uint64_t{7}}, nullptr);
  ASSERT_TRUE(small);
  EXPECT_EQ(parsePropertyList(*small, nullptr), PlistValue(PlistArray{std::int64_t{7}}));
}

TEST(PlistSerializationTest, ReadsXml) {
  const std::string xml = R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist SYSTEM "plist.dtd">
<plist version="1.0">
<dict>
  <!-- <array><array> in a comment is not nesting -->
  <key>Identifier</key><string>com.example.app</string>
  <key>Minus</key><integer>-1</integer>
  <key>Big</key><integer>18446744073709551615</integer>
  <key>Flag</key><true/>
  <key>Escaped</key><string>x &amp; y</string>
  <key>Blob</key><data>AAEC/w==</data>
  <key>When</key><date>2001-01-01T00:00:10Z</date>
  <key>Nested</key><dict><key>Inner</key><array><string>a</string></array></dict>
</dict>
</plist>)";
  std::string error;
  const auto value = parsePropertyList(bytesOf(xml), &error);
  ASSERT_TRUE(value) << error;
  const PlistValue expected = PlistDictionary{
      {"Identifier", "com.example.app"},
      {"Minus", std::int64_t{-1}},
      {"Big", std::numeric_limits<std::uint64_t>::max()},
      {"Flag", true},
      {"Escaped", "x & y"},
      {"Blob", PlistData{0, 1, 2, 255}},
      {"When", PlistDate{10}},
      {"Nested", PlistDictionary{{"Inner", PlistArray{"a"}}}},
  };
  EXPECT_EQ(*value, expected) << value->description();
}

// Malformed bytes in general are the fuzzer's business; these are the limits
// the rest of the daemon relies on.
TEST(PlistSerializationTest, InputBeyondTheLimitsIsRefused) {
  Bytes tooLarge = bytesOf("<plist><string>");
  tooLarge.resize(kMaxPropertyListSize + 1, 'x');
  const struct {
    const char* name;
    Bytes input;
    std::string reason;
  } rows[] = {
      {"binary nested too deeply", nestedArrays(kMaxPropertyListDepth + 1, 1), "nested too deeply"},
      {"xml nested too deeply", bytesOf(nestedXml(kMaxPropertyListDepth + 1)), "nested too deeply"},
      {"self-referencing array", binaryPlist({Bytes{0xA1, 0x00, 0x00}}), "cycle"},
      {"shared subtrees that expand beyond the limit", nestedArrays(64, 2), "too many objects"},
      {"UID object", binaryPlist({Bytes{0x80, 0x05}}), "UID"},
      {"too large", tooLarge, "too large"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::string error;
    EXPECT_FALSE(parsePropertyList(row.input, &error));
    EXPECT_NE(error.find(row.reason), std::string::npos) << error;
  }
  // One level less is still read.
  EXPECT_TRUE(parsePropertyList(nestedArrays(kMaxPropertyListDepth, 1), nullptr));
  EXPECT_TRUE(parsePropertyList(bytesOf(nestedXml(kMaxPropertyListDepth)), nullptr));
}

// Objects our own writer never produces, as other writers may.
TEST(PlistSerializationTest, ReadsBinaryObjectsOfOtherWriters) {
  const struct {
    const char* name;
    Bytes input;
    std::optional<PlistValue> value;
    std::string reason;
  } rows[] = {
      {"UTF-16 with a surrogate pair",
       binaryPlist({Bytes{0x63, 0x00, 0x41, 0xD8, 0x3D, 0xDE, 0x00}}),
       PlistValue("A\xF0\x9F\x98\x80"), ""},
      {"four-byte real", binaryPlist({Bytes{0x22, 0x3F, 0xC0, 0x00, 0x00}}), PlistValue(1.5), ""},
      {"set", binaryPlist({Bytes{0xC1, 0x00, 0x01}, Bytes{0x10, 0x07}}), PlistArray{7}, ""},
      {"lone surrogate", binaryPlist({Bytes{0x61, 0xD8, 0x3D}}), std::nullopt, "not UTF-16"},
      {"NUL in a string", binaryPlist({Bytes{0x53, 'a', 0, 'b'}}), std::nullopt, "NUL"},
      {"integer key", binaryPlist({Bytes{0xD1, 0x00, 0x01, 0x00, 0x01}, Bytes{0x10, 0x07}}),
       std::nullopt, "not a string"},
      {"null object", binaryPlist({Bytes{0x00}}), std::nullopt, "unsupported"},
      {"string beyond the objects", binaryPlist({Bytes{0x5F, 0x10, 0x40, 'a'}}), std::nullopt,
       "truncated"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::string error;
    const std::optional<PlistValue> value = parsePropertyList(row.input, &error);
    EXPECT_EQ(value, row.value) << error;
    if (!row.value) {
      EXPECT_NE(error.find(row.reason), std::string::npos) << error;
    }
  }
}

TEST(PlistSerializationTest, ValuesTheFormatCannotHoldAreRefused) {
  PlistValue deep = PlistArray{};
  for (int i = 0; i < kMaxPropertyListDepth; ++i) deep = PlistArray{deep};
  const struct {
    const char* name;
    PlistValue value;
  } rows[] = {
      {"string that is not UTF-8", PlistDictionary{{"k", "bad\xFF"}}},
      {"NUL in a key", PlistDictionary{{std::string("a\0b", 3), 1}}},
      {"nested too deeply", deep},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::string error;
    EXPECT_FALSE(serializeBinaryPropertyList(row.value, &error));
    EXPECT_FALSE(error.empty());
  }
}

}  // namespace
}  // namespace kestrel::platform
