// Info values and the metadata query: what reaches the metadata file, and
// the containers that cannot be named or found.
#include <gtest/gtest.h>

#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

constexpr const char* kKey = "com.example.size";

class InfoValuesTest : public testing::StoreTest {
 protected:
  // The info dictionary as the metadata file holds it.
  static std::optional<PlistDictionary> infoOnDisk(const KSTMetadataRef& container) {
    KSTErrorRef error;
    auto read =
        KSTMetadata::readAndValidateMetadataAtUrl(container->url(), container->uid(), true, &error);
    EXPECT_TRUE(read) << testing::messageOf(error);
    return read ? read->info() : std::nullopt;
  }
};

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

TEST_F(InfoValuesTest, ContainersThatCannotBeNamedOrFoundAreRefused) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  // On disk, but never cached: not found either.
  const KSTMetadataRef unknown = testing::writeContainer(501, 2, "com.example.unknown");
  const struct {
    const char* label;
    std::optional<platform::Uuid> uuid;
    KSTContainerClass containerClass;
    std::optional<std::string> key;
    std::string identifier;
    std::uint64_t code;
    const char* logged;
  } rows[] = {
      {"no UUID", std::nullopt, 2, kKey, "com.example.app", kKSTErrorInvalidObject,
       "Can't act on an invalid object: userId: 501, UUID: (null), Class: 2"},
      {"class 0", app->uuid(), 0, kKey, "com.example.app", kKSTErrorInvalidObject, nullptr},
      {"class 14", app->uuid(), 14, kKey, "com.example.app", kKSTErrorInvalidObject, nullptr},
      {"no key", app->uuid(), 2, std::nullopt, "com.example.app", kKSTErrorInvalidParameter,
       "Can't set nil or non-Strand key: (null)"},
      {"another UUID", platform::Uuid::random(), 2, kKey, "com.example.app", kKSTErrorNotFound,
       "No Container with userId: 501 UUID: "},
      {"not cached", unknown->uuid(), 2, kKey, "com.example.unknown", kKSTErrorNotFound, nullptr},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.label);
    std::uint64_t code = kKSTSuccess;
    installer.setInfoValue(PlistValue(true), row.key, 501, row.uuid, row.identifier,
                           row.containerClass, true, &code);
    EXPECT_EQ(code, row.code);
    if (row.logged) {
      EXPECT_TRUE(fakes.logged(row.logged));
    }
    if (row.code == kKSTErrorInvalidParameter) continue;  // the metadata query takes no key
    code = kKSTSuccess;
    EXPECT_FALSE(
        installer.metadataForUser(501, row.uuid, row.identifier, row.containerClass, &code));
    EXPECT_EQ(code, row.code);
  }
  EXPECT_FALSE(infoOnDisk(app));
}

TEST_F(InfoValuesTest, MetadataReplyCarriesTheInfoDictionaryOnlyWhenAskedFor) {
  const KSTMetadataRef app = make(501, 2, "com.example.app");
  ASSERT_TRUE(app);
  std::uint64_t code = kKSTSuccess;
  installer.setInfoValue(PlistValue("x"), kKey, 501, app->uuid(), "com.example.app", 2, true,
                         &code);
  for (const bool asked : {false, true}) {
    SCOPED_TRACE(asked);
    platform::MessageDictionary request;
    request.setUint64("ContainerClass", 2);
    request.setUint64("UserID", 501);
    request.setUuid("UUID", app->uuid());
    request.setString("Identifier", "com.example.app");
    request.setBoolean("InfoDictRequested", asked);
    platform::MessageDictionary reply;
    ASSERT_EQ(testing::runHandler(KSTHandleGetMetadata, installer, request, &reply), kKSTSuccess);
    EXPECT_EQ(reply.string("ReplyPath"), app->url().path());
    EXPECT_FALSE(reply.boolean("ReplyTransient"));
    EXPECT_EQ(reply.dictionary("ReplyInfoDictionary") != nullptr, asked);
  }
}

}  // namespace
}  // namespace kestrel
