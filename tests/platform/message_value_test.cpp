#include <gtest/gtest.h>

#include <string>

#include "platform/message_ipc.h"
#include "platform/uuid.h"

namespace kestrel::platform {
namespace {

// One key of every type the model has.
MessageDictionary everyType() {
  MessageDictionary d;
  d.setUint64("u", 7);
  d.setInt64("i", -7);
  d.setBoolean("b", true);
  d.setString("s", "text");
  d.setData("data", {1, 2, 3});
  d.setUuid("uuid", *Uuid::parse("00112233-4455-6677-8899-AABBCCDDEEFF"));
  d.setReal("d", 2.5);
  d.setArray("a", {MessageValue::fromString("x")});
  MessageDictionary inner;
  inner.setBoolean("flag", true);
  d.setDictionary("dict", inner);
  return d;
}

TEST(MessageValueTest, AbsentAndWrongTypedKeysReadAsZeroFalseOrNothing) {
  const MessageDictionary d = everyType();
  struct Row {
    const char* key;
    bool uint64, int64, boolean, string, uuid, data, real, array, dictionary;
  };
  // Which getter sees a value under each key; every other getter reads the
  // key as absent.
  const Row rows[] = {
      {"u", true, false, false, false, false, false, false, false, false},
      {"i", false, true, false, false, false, false, false, false, false},
      {"b", false, false, true, false, false, false, false, false, false},
      {"s", false, false, false, true, false, false, false, false, false},
      {"data", false, false, false, false, false, true, false, false, false},
      {"uuid", false, false, false, false, true, true, false, false, false},
      {"d", false, false, false, false, false, false, true, false, false},
      {"a", false, false, false, false, false, false, false, true, false},
      {"dict", false, false, false, false, false, false, false, false, true},
      {"missing", false, false, false, false, false, false, false, false, false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.key);
    EXPECT_EQ(d.uint64(row.key) != 0, row.uint64);
    EXPECT_EQ(d.int64(row.key) != 0, row.int64);
    EXPECT_EQ(d.boolean(row.key), row.boolean);
    EXPECT_EQ(d.string(row.key).has_value(), row.string);
    EXPECT_EQ(d.uuid(row.key).has_value(), row.uuid);
    EXPECT_EQ(d.data(row.key).has_value(), row.data);
    EXPECT_EQ(d.real(row.key).has_value(), row.real);
    EXPECT_EQ(d.array(row.key) != nullptr, row.array);
    EXPECT_EQ(d.dictionary(row.key) != nullptr, row.dictionary);
    EXPECT_EQ(d.plist(row.key).has_value(), std::string(row.key) != "missing");
  }
  EXPECT_EQ(d.uint64("u"), 7u);
  EXPECT_EQ(d.int64("i"), -7);
  EXPECT_EQ(d.uuid("uuid")->string(), "00112233-4455-6677-8899-AABBCCDDEEFF");
}

TEST(MessageValueTest, UuidTextIsUpperCaseAndParsingIsStrict) {
  const auto parsed = Uuid::parse("a1b2c3d4-e5f6-4711-8899-aabbccddeeff");
  ASSERT_TRUE(parsed);
  EXPECT_EQ(parsed->string(), "A1B2C3D4-E5F6-4711-8899-AABBCCDDEEFF");
  EXPECT_FALSE(Uuid::parse("A1B2C3D4E5F647118899AABBCCDDEEFF"));
  const Uuid a = Uuid::random();
  EXPECT_NE(a, Uuid::random());
  EXPECT_EQ(Uuid::parse(a.string()), a);
}

TEST(MessageValueTest, PlistRoundTripKeepsEveryType) {
  const MessageDictionary d = everyType();
  const auto plist = d.toPlist();
  ASSERT_TRUE(plist);
  // Signed and unsigned stay apart; a UUID becomes 16 bytes of data.
  EXPECT_EQ(plist->at("u").type(), PlistValue::Type::UnsignedInteger);
  EXPECT_EQ(plist->at("i").type(), PlistValue::Type::Integer);
  EXPECT_EQ(plist->at("uuid").data()->size(), 16u);
  EXPECT_EQ(plist->at("d").type(), PlistValue::Type::Real);
  EXPECT_EQ(*plist->at("dict").find("flag"), PlistValue(true));

  const auto back = MessageDictionary::fromPlist(*plist);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, d);
}

TEST(MessageValueTest, NestingBeyondTheLimitDoesNotConvert) {
  auto nested = [](std::size_t levels) {
    PlistValue value(std::string("leaf"));
    for (std::size_t i = 0; i < levels; ++i) value = PlistValue(PlistArray{value});
    return value;
  };
  MessageDictionary d;
  EXPECT_TRUE(d.setPlist("ok", nested(kMaxMessageDepth)));
  EXPECT_TRUE(d.plist("ok"));
  EXPECT_FALSE(d.setPlist("deep", nested(kMaxMessageDepth + 1)));
  EXPECT_FALSE(d.contains("deep"));
}

}  // namespace
}  // namespace kestrel::platform
