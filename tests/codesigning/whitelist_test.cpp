#include "codesigning/whitelist.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>

namespace kestrel {
namespace {

TEST(WhitelistTest, AnswersByClassAndComparesExactly) {
  struct Row {
    const char* identifier;
    KSTContainerClass containerClass;
    bool wellknown;
  };
  const Row rows[] = {
      {"com.zorvane.egretd", 12, true},
      {"com.zorvane.ternd", 12, true},
      {"com.zorvane.egretd", 13, false},
      {"systemgroup.com.zorvane.heron.tiles", 13, true},
      {"systemgroup.com.zorvane.ibis.profiles", 13, true},
      {"systemgroup.com.zorvane.heron.tiles", 12, false},
      {"com.zorvane.egretd", 7, false},
      {"systemgroup.com.zorvane.marten.managed", 7, false},
      {"systemgroup.com.zorvane.plover.info", 0, false},
      {"systemgroup.com.zorvane.plover.info", 14, false},
      {"COM.ZORVANE.EGRETD", 12, false},
      {"com.zorvane.egret", 12, false},
      {"com.zorvane.egretd ", 12, false},
      {"systemgroup.com.zorvane.heron", 13, false},
      {"", 12, false},
  };
  const KSTWhitelist& whitelist = KSTWhitelist::sharedWhitelist();
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(row.identifier) + " class " + std::to_string(row.containerClass));
    EXPECT_EQ(whitelist.containerIdIsWellknown(row.identifier, row.containerClass), row.wellknown);
    EXPECT_EQ(whitelist.wellknownContainerForId(row.identifier, row.containerClass),
              row.wellknown ? std::optional<std::string>(row.identifier) : std::nullopt);
    if (row.containerClass == 12) {
      EXPECT_EQ(whitelist.systemContainerIdIsWellknown(row.identifier), row.wellknown);
      EXPECT_EQ(whitelist.wellknownSystemContainerForId(row.identifier).has_value(), row.wellknown);
    }
    if (row.containerClass == 13) {
      EXPECT_EQ(whitelist.systemGroupContainerIdIsWellknown(row.identifier), row.wellknown);
      EXPECT_EQ(whitelist.wellknownSystemGroupContainerForId(row.identifier).has_value(),
                row.wellknown);
    }
  }
}

TEST(WhitelistTest, UsesTheTablesItIsGiven) {
  const KSTWhitelist whitelist({{"a.b", "dirA"}}, {{"group.a", "dirG"}});
  EXPECT_EQ(whitelist.wellknownContainerForId("a.b", 12), "dirA");
  EXPECT_EQ(whitelist.wellknownContainerForId("group.a", 13), "dirG");
  EXPECT_FALSE(whitelist.containerIdIsWellknown("com.zorvane.egretd", 12));
}

}  // namespace
}  // namespace kestrel
