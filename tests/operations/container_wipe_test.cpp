// Wiping a data container: who may, and what is left afterwards.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "store/metadata.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

using ContainerWipeTest = testing::StoreTest;

TEST_F(ContainerWipeTest, OnlyEntitledClientsWipeAndTheContainerKeepsItsPlaceAndUUID) {
  make(501, 2, "com.example.app");
  make(501, 4, "com.example.plugin");
  make(501, 4, "com.example.other-plugin");
  KSTClientConnection wiper(std::string("com.example.wiper"), 501, false,
                            std::vector<std::string>{"com.example.plugin"});
  struct Row {
    KSTClientConnection* client;
    KSTContainerClass containerClass;
    std::optional<std::string> identifier;
    std::uint64_t code;
    const char* logged;
  } rows[] = {
      {&wiper, 4, std::nullopt, kKSTErrorMissingIdentifier,
       "Can't wipe container with nil identifier: (null), userId: 501"},
      {&installer, 12, "com.zorvane.egretd", kKSTErrorInvalidObject,
       "Can't wipe container non-data container of type: 12"},
      {&wiper, 2, "com.example.app", kKSTErrorInvalidObject,
       "Can't wipe container with of type: 2"},
      {&wiper, 4, "com.example.other-plugin", kKSTErrorNotEntitled,
       "Not entitled to wipe container with identifier: com.example.other-plugin"},
      {&installer, 2, "com.example.none", kKSTErrorNotFound,
       "Failed to lookup existing container to wipe-identifier: com.example.none"},
      {&wiper, 4, "com.example.plugin", kKSTSuccess, nullptr},
      {&installer, 2, "com.example.app", kKSTSuccess, nullptr},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.identifier.value_or("(none)"));
    const KSTMetadataRef before =
        row.identifier ? testing::existingContainer(501, row.containerClass, *row.identifier)
                       : nullptr;
    if (before) std::ofstream(before->url().path() + "/Documents/data") << "content";
    std::uint64_t code = kKSTSuccess;
    row.client->deleteDataContainerContentForUser(501, row.identifier, row.containerClass, &code);
    EXPECT_EQ(code, row.code);
    if (row.logged) {
      EXPECT_TRUE(fakes.logged(row.logged, testing::Match::Prefix));
    }
    if (!before) continue;
    const KSTMetadataRef after =
        testing::existingContainer(501, row.containerClass, *row.identifier);
    ASSERT_TRUE(after);
    EXPECT_EQ(after->url(), before->url());
    EXPECT_EQ(after->uuid(), before->uuid());
    EXPECT_EQ(fs::exists(after->url().path() + "/Documents/data"), row.code != kKSTSuccess);
    if (row.code != kKSTSuccess) continue;
    EXPECT_TRUE(fs::is_directory(after->url().path() + "/Library/Preferences"));
    // The UUID is the container's on disk too, for the next start.
    const auto reread = KSTMetadata::readAndValidateMetadataAtUrl(after->url(), 501, true, nullptr);
    ASSERT_TRUE(reread);
    EXPECT_EQ(reread->uuid(), before->uuid());
  }
  // The old content went to death row, and the wipe's sweep took it away.
  KSTDeathRowQueue()->sync([] {});
  EXPECT_TRUE(testing::namesIn(testing::deathRowDirectory()).empty());
}

}  // namespace
}  // namespace kestrel
