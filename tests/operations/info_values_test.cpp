// Info values and the metadata query: what reaches the metadata file and the
// reply. The containers they refuse are checked with the other per-container
// operations (structure_repair_test).
#include <gtest/gtest.h>

#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

constexpr const char* kKey = "com.example.size";

using InfoValuesTest = testing::StoreTest;
using testing::infoOnDisk;

TEST_F(InfoValuesTest, SetGetAndRemoveReachTheMetadataFile) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  const PlistValue value(PlistDictionary{{"bytes", std::int64_t{4096}}});
  std::uint64_t code = kKSTSuccess;
  installer.setInfoValue(value, kKey, 501, app->uuid(), "com.example.app", 2, true, &code);
  ASSERT_EQ(code, kKSTSuccess);
  EXPECT_EQ(installer.infoValueForKey(kKey, 501, app->uuid(), "com.example.app", 2, true, &code),
            value);
  ASSERT_TRUE(infoOnDisk(app));
  EXPECT_EQ(infoOnDisk(app)->at(kKey), value);

  // No value removes the key; asking for it then is an answer, not a fault.
  installer.setInfoValue(std::nullopt, kKey, 501, app->uuid(), "com.example.app", 2, true, &code);
  ASSERT_EQ(code, kKSTSuccess);
  EXPECT_EQ(infoOnDisk(app)->count(kKey), 0u);
  fakes.logging->clear();
  EXPECT_FALSE(
      installer.infoValueForKey(kKey, 501, app->uuid(), "com.example.app", 2, true, &code));
  EXPECT_EQ(code, kKSTErrorInfoValueNotFound);
  EXPECT_FALSE(fakes.logged("Didn't find info value"));
}

TEST_F(InfoValuesTest, MetadataReplyCarriesTheInfoDictionaryOnlyWhenAskedFor) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  platform::MessageDictionary request = testing::request(
      {{"ContainerClass", 2u}, {"UserID", 501u}, {"Identifier", "com.example.app"}});
  request.setUuid("UUID", app->uuid());
  // Asked for, absent; present, not asked for; present and asked for.
  const std::pair<bool, bool> cases[] = {{false, true}, {true, false}, {true, true}};
  for (const auto& [hasInfo, asked] : cases) {
    SCOPED_TRACE(::testing::Message() << "info " << hasInfo << ", asked " << asked);
    std::uint64_t code = kKSTSuccess;
    if (hasInfo) {
      installer.setInfoValue(PlistValue("x"), kKey, 501, app->uuid(), "com.example.app", 2, true,
                             &code);
    }
    request.setBoolean("InfoDictRequested", asked);
    platform::MessageDictionary reply;
    ASSERT_EQ(testing::runHandler(KSTHandleGetMetadata, installer, request, &reply), kKSTSuccess);
    EXPECT_EQ(reply.string("ReplyPath"), app->url().path());
    EXPECT_FALSE(reply.boolean("ReplyTransient"));
    ASSERT_EQ(reply.dictionary("ReplyInfoDictionary") != nullptr, hasInfo && asked);
    if (hasInfo && asked) {
      EXPECT_EQ(reply.plist("ReplyInfoDictionary"), PlistValue(*infoOnDisk(app)));
    }
  }
}

}  // namespace
}  // namespace kestrel
