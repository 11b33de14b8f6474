#include <gtest/gtest.h>

#include <limits>

#include "platform/plist.h"

namespace kestrel {
namespace {

TEST(PlistValueTest, EqualityIsExactButIgnoresTheSignednessOfIntegers) {
  const std::uint64_t huge = std::numeric_limits<std::uint64_t>::max();
  struct Row {
    const char* label;
    PlistValue a;
    PlistValue b;
    bool equal;
  } rows[] = {
      {"same signed", std::int64_t{5}, std::int64_t{5}, true},
      {"signed and unsigned of one value", std::int64_t{5}, std::uint64_t{5}, true},
      {"negative is no unsigned value", std::int64_t{-1}, huge, false},
      {"integer and real", std::int64_t{5}, 5.0, false},
      {"bool and integer", true, std::int64_t{1}, false},
      {"string and data", "ab", PlistData{'a', 'b'}, false},
      {"nested dictionaries", PlistDictionary{{"k", PlistArray{std::uint64_t{2}, "x"}}},
       PlistDictionary{{"k", PlistArray{std::int64_t{2}, "x"}}}, true},
      {"dictionaries differing in one value", PlistDictionary{{"k", 1}}, PlistDictionary{{"k", 2}},
       false},
      {"dates", PlistDate{1.5}, PlistDate{1.5}, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    EXPECT_EQ(row.a == row.b, row.equal);
    EXPECT_EQ(row.b == row.a, row.equal);
  }
}

TEST(PlistValueTest, NumbersConvertOnlyWhenTheTargetCanHoldThem) {
  EXPECT_EQ(PlistValue(std::int64_t{-3}).unsignedInteger(), std::nullopt);
  EXPECT_EQ(PlistValue(std::uint64_t{1} << 63).signedInteger(), std::nullopt);
  EXPECT_EQ(PlistValue(std::uint64_t{7}).signedInteger(), 7);
  EXPECT_EQ(PlistValue(2.9).unsignedInteger(), 2u);
  EXPECT_EQ(PlistValue(-1.0).unsignedInteger(), std::nullopt);
  EXPECT_EQ(PlistValue(1e300).signedInteger(), std::nullopt);
  EXPECT_EQ(PlistValue("7").signedInteger(), std::nullopt);
  EXPECT_EQ(PlistValue(PlistDictionary{{"a", 1}}).find("b"), nullptr);
  EXPECT_EQ(PlistValue("x").find("a"), nullptr);
}

}  // namespace
}  // namespace kestrel
