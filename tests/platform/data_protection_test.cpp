#include "platform/data_protection.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>

#include "platform/unique_fd.h"
#include "support/fake_services.h"

namespace kestrel::platform {
namespace {

// While locked only a change into or out of class 1 is refused, so that
// containers (class 0) can still be made.
TEST(DataProtectionTest, LockedDeviceRefusesOnlyChangesTouchingClassOne) {
  testing::FakeServices fakes;
  struct Row {
    std::optional<std::int32_t> current;
    std::int32_t wanted;
    bool locked;
    int result;
  } rows[] = {
      {std::nullopt, 0, true, 0},
      {4, 0, true, 0},
      {3, 4, true, 0},
      {std::nullopt, 1, true, EPERM},
      {3, 1, true, EPERM},
      {1, 4, true, EPERM},
      {1, 1, true, EPERM},
      {1, 4, false, 0},
      {std::nullopt, 1, false, 0},
  };
  int n = 0;
  for (const Row& row : rows) {
    SCOPED_TRACE(n);
    const std::string dir = fakes.scratch.resolve("/d" + std::to_string(n++));
    ASSERT_EQ(::mkdir(dir.c_str(), 0755), 0);
    const UniqueFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(fd);
    fakes.keyBag->setLockState(0);
    if (row.current) {
      ASSERT_EQ(setProtectionClass(fd.get(), *row.current), 0);
    }
    fakes.keyBag->setLockState(row.locked ? 1 : 0);
    EXPECT_EQ(setProtectionClass(fd.get(), row.wanted), row.result);
    std::optional<std::int32_t> now;
    ASSERT_EQ(getProtectionClass(fd.get(), &now), 0);
    EXPECT_EQ(now, row.result == 0 ? std::optional(row.wanted) : row.current);
  }
}

}  // namespace
}  // namespace kestrel::platform
