// The list of valid user ids is computed once per process, so each case is a
// test of its own (every test runs in its own process).
#include <gtest/gtest.h>

#include "daemon/daemon_state.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

std::vector<std::uint32_t> collect() {
  std::vector<std::uint32_t> ids;
  KSTForEachValidUserId([&](std::uint32_t id) { ids.push_back(id); });
  return ids;
}

TEST(ValidUserIdsTest, SingleUserDeviceHasOnlyTheDefaultMobileUser) {
  testing::FakeServices fakes;
  fakes.keyBag->setUserSessionIds({502, 503});  // ignored outside multi-user mode
  EXPECT_EQ(collect(), std::vector<std::uint32_t>{501});
  EXPECT_EQ(collect(), std::vector<std::uint32_t>{501});
}

TEST(ValidUserIdsTest, MultiUserDeviceHasItsSessionsInOrderComputedOnce) {
  testing::FakeServices fakes;
  fakes.keyBag->setUserTypeInfo(platform::UserTypeInfo{platform::DeviceMode::MultiUser});
  fakes.keyBag->setUserSessionIds({503, 501, 502});
  EXPECT_EQ(collect(), (std::vector<std::uint32_t>{503, 501, 502}));
  fakes.keyBag->setUserSessionIds({600});
  EXPECT_EQ(collect(), (std::vector<std::uint32_t>{503, 501, 502}));
}

TEST(ValidUserIdsTest, FailedSessionListIsLoggedAndFallsBackToTheDefaultUser) {
  testing::FakeServices fakes;
  fakes.keyBag->setUserTypeInfo(platform::UserTypeInfo{platform::DeviceMode::MultiUser});
  fakes.keyBag->setUserSessionError("logind unavailable");
  EXPECT_EQ(collect(), std::vector<std::uint32_t>{501});
  bool logged = false;
  for (const auto& line : fakes.logging->lines()) {
    logged |= line.tag == "_getListOfValidUserIds" && line.level == 3 &&
              line.message.find("logind unavailable") != std::string::npos;
  }
  EXPECT_TRUE(logged);
}

TEST(ValidUserIdsTest, DeviceWithoutUserTypeInformationHasNoList) {
  testing::FakeServices fakes;
  fakes.keyBag->setUserTypeInfo(std::nullopt);
  EXPECT_EQ(collect(), std::vector<std::uint32_t>{501});
}

}  // namespace
}  // namespace kestrel
