#include "platform/format.h"

#include <gtest/gtest.h>

#include <cstdint>

#include "platform/plist.h"

namespace kestrel {
namespace {

struct Described {
  std::string description() const { return "<described>"; }
};

TEST(FormatTest, RendersEachPlaceholderLikeTheSystemDoes) {
  struct Row {
    const char* label;
    std::string actual;
    std::string expected;
  };
  const std::uint32_t uid = 501;
  const std::uint64_t big = 18446744073709551615ULL;
  const std::string long1(1000, 'x');
  const Row rows[] = {
      {"plain text", formatMessage("no placeholders"), "no placeholders"},
      {"%d", formatMessage("%d: %@", 42, "msg"), "42: msg"},
      {"%u", formatMessage("userId: %u", uid), "userId: 501"},
      {"%u truncates to 32 bits", formatMessage("%u", big), "4294967295"},
      {"%d of a large unsigned is int", formatMessage("%d", std::uint64_t{4294967295u}), "-1"},
      {"%llu", formatMessage("Command %llu", big), "Command 18446744073709551615"},
      {"%lld negative", formatMessage("%lld", std::int64_t{-5}), "-5"},
      {"%ld", formatMessage("class: %ld", std::int64_t{12}), "class: 12"},
      {"%x", formatMessage("perms %x", 0x3ffe), "perms 3ffe"},
      {"%s", formatMessage("path %s", std::string("/a b")), "path /a b"},
      {"%s of null", formatMessage("%s", static_cast<const char*>(nullptr)), "(null)"},
      {"%@ of string", formatMessage("%@", std::string("com.example")), "com.example"},
      {"%@ of number", formatMessage("%@", 7), "7"},
      {"%@ of absent object", formatMessage("%@", nullptr), "(null)"},
      {"%@ of optional", formatMessage("%@", std::optional<std::string>()), "(null)"},
      {"%@ of object", formatMessage("%@", Described{}), "<described>"},
      {"%@ of plist array", formatMessage("%@", PlistValue(PlistArray{"a", 1})),
       "(\n    a,\n    1\n)"},
      {"%%", formatMessage("100%% done"), "100% done"},
      {"width", formatMessage("[%5d]", 42), "[   42]"},
      {"missing argument", formatMessage("%@ and %@", "one"), "one and (null)"},
      {"dangling percent", formatMessage("50%"), "50%"},
      {"quoted %@", formatMessage("Container with identifier: \"%@\" Not Found", "x"),
       "Container with identifier: \"x\" Not Found"},
      {"long output is not truncated", formatMessage("%s-%s", long1, long1), long1 + "-" + long1},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    EXPECT_EQ(row.actual, row.expected);
  }
}

}  // namespace
}  // namespace kestrel
