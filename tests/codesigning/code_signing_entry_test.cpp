#include "codesigning/code_signing_entry.h"

#include <gtest/gtest.h>

namespace kestrel {
namespace {

PlistDictionary sampleInfo() {
  return PlistDictionary{
      {"com.zorvane.Kestrel.Entitlements",
       PlistDictionary{{"com.zorvane.security.application-groups", PlistArray{"group.a"}}}},
      {"Other", 7}};
}

TEST(CodeSigningEntryTest, SerializedFormRoundTripsLeavesAbsentValuesOutAndHashesByValue) {
  KSTCodeSigningEntry empty;
  const PlistDictionary emptyForm = empty.serialize();
  EXPECT_EQ(emptyForm.count("CodeSigningInfo"), 0u);
  EXPECT_EQ(emptyForm.count("ChildBundleIds"), 0u);
  EXPECT_EQ(emptyForm.at("Invalid"), PlistValue(false));
  EXPECT_EQ(emptyForm.at("DataContainerClass"), PlistValue(std::uint64_t{0}));

  KSTCodeSigningEntry full(sampleInfo(), kKSTContainerClassDataApplication);
  full.setChildBundleIdentifiers(std::vector<std::string>{"com.b.plugin", "com.a.plugin"});
  full.setInvalid(true);
  full.setRegisteredByCaller(true);
  const KSTCodeSigningEntry back =
      KSTCodeSigningEntry::initWithSerializedDictionary(full.serialize());
  EXPECT_EQ(back, full);
  EXPECT_EQ(back.hash(), full.hash());
  EXPECT_EQ(KSTCodeSigningEntry::initWithSerializedDictionary(emptyForm), empty);

  // Equal information hashes equal, whatever the signedness of its integers.
  const KSTCodeSigningEntry signedInfo(PlistDictionary{{"n", std::int64_t{5}}}, 0);
  const KSTCodeSigningEntry unsignedInfo(PlistDictionary{{"n", std::uint64_t{5}}}, 0);
  EXPECT_EQ(signedInfo, unsignedInfo);
  EXPECT_EQ(signedInfo.hash(), unsignedInfo.hash());
}

TEST(CodeSigningEntryTest, ValuesOfTheWrongTypeReadAsMissing) {
  // A signed integer is what the file reader gives back for small numbers.
  const PlistDictionary serialized{{"CodeSigningInfo", "not a dictionary"},
                                   {"ChildBundleIds", PlistArray{"com.child", 5}},
                                   {"Invalid", "YES"},
                                   {"Placeholder", true},
                                   {"DataContainerClass", std::int64_t{2}}};
  const auto entry = KSTCodeSigningEntry::initWithSerializedDictionary(serialized);
  EXPECT_FALSE(entry.codeSigningInfo().has_value());
  EXPECT_EQ(entry.childBundleIdentifiers(), (std::vector<std::string>{"com.child"}));
  EXPECT_FALSE(entry.invalid());
  EXPECT_TRUE(entry.placeholder());
  EXPECT_EQ(entry.dataContainerClass(), kKSTContainerClassDataApplication);

  const auto negative =
      KSTCodeSigningEntry::initWithSerializedDictionary({{"DataContainerClass", std::int64_t{-3}}});
  EXPECT_EQ(negative.dataContainerClass(), 0u);
}

TEST(CodeSigningEntryTest, EqualityComparesEveryField) {
  const KSTCodeSigningEntry base(sampleInfo(), 2);
  const std::pair<const char*, void (*)(KSTCodeSigningEntry&)> rows[] = {
      {"info absent", [](KSTCodeSigningEntry& e) { e.setCodeSigningInfo(std::nullopt); }},
      {"info differs", [](KSTCodeSigningEntry& e) { e.setCodeSigningInfo(PlistDictionary{}); }},
      {"children present",
       [](KSTCodeSigningEntry& e) { e.setChildBundleIdentifiers(std::vector<std::string>{}); }},
      {"invalid", [](KSTCodeSigningEntry& e) { e.setInvalid(true); }},
      {"placeholder", [](KSTCodeSigningEntry& e) { e.setPlaceholder(true); }},
      {"registered by caller", [](KSTCodeSigningEntry& e) { e.setRegisteredByCaller(true); }},
      {"class", [](KSTCodeSigningEntry& e) { e.setDataContainerClass(4); }},
  };
  for (const auto& [label, change] : rows) {
    SCOPED_TRACE(label);
    KSTCodeSigningEntry changed = base;
    change(changed);
    EXPECT_FALSE(changed.isEqual(base));
    EXPECT_FALSE(base.isEqual(changed));
  }
  KSTCodeSigningEntry ordered = base, reordered = base;
  ordered.setChildBundleIdentifiers(std::vector<std::string>{"a", "b"});
  reordered.setChildBundleIdentifiers(std::vector<std::string>{"b", "a"});
  EXPECT_NE(ordered, reordered);
  EXPECT_EQ(base, KSTCodeSigningEntry(sampleInfo(), 2));
}

}  // namespace
}  // namespace kestrel
