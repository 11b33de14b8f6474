#include "codesigning/whitelist.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <tuple>

namespace kestrel {
namespace {

TEST(WhitelistTest, AnswersByClassAndComparesExactly) {
  // Identifier, class and whether it is well known there.
  const std::tuple<std::string, KSTContainerClass, bool> rows[] = {
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
  for (const auto& [identifier, containerClass, wellknown] : rows) {
    SCOPED_TRACE(identifier + " class " + std::to_string(containerClass));
    EXPECT_EQ(whitelist.containerIdIsWellknown(identifier, containerClass), wellknown);
    EXPECT_EQ(whitelist.wellknownContainerForId(identifier, containerClass),
              wellknown ? std::optional(identifier) : std::nullopt);
    if (containerClass == 12) {
      EXPECT_EQ(whitelist.systemContainerIdIsWellknown(identifier), wellknown);
      EXPECT_EQ(whitelist.wellknownSystemContainerForId(identifier).has_value(), wellknown);
    }
    if (containerClass == 13) {
      EXPECT_EQ(whitelist.systemGroupContainerIdIsWellknown(identifier), wellknown);
      EXPECT_EQ(whitelist.wellknownSystemGroupContainerForId(identifier).has_value(), wellknown);
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
