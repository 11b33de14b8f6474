#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <regex>
#include <string>

#include "platform/linux/named_semaphores_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using testing::ScratchRoot;

TEST(NamedSemaphoresTest, NamesAreScopedToTheRoot) {
  EXPECT_EQ(scopedSemaphoreName(FilesystemRoot("/"), "/kestreld.fb_check"), "/kestreld.fb_check");

  const std::string scoped = scopedSemaphoreName(FilesystemRoot("/tmp/r1"), "kestreld.fb_check");
  EXPECT_TRUE(std::regex_match(scoped, std::regex(R"(/kestreld\.fb_check\.[0-9a-f]{16})")))
      << scoped;
  EXPECT_NE(scoped, scopedSemaphoreName(FilesystemRoot("/tmp/r2"), "kestreld.fb_check"));
  EXPECT_EQ(scoped, scopedSemaphoreName(FilesystemRoot("/tmp/r1/"), "kestreld.fb_check"));
}

TEST(NamedSemaphoresTest, AMarkLivesUntilRemovedAndOnlyBeneathItsOwnRoot) {
  ScratchRoot first;
  ScratchRoot second;
  LinuxNamedSemaphores mine(first.root());
  LinuxNamedSemaphores theirs(second.root());
  const std::string name = "kestreld.test." + std::to_string(::getpid());
  // Unlinks the marks when the test ends, however it ends.
  const std::shared_ptr<void> cleanup(nullptr, [&](void*) {
    mine.remove(name);
    theirs.remove(name);
  });

  EXPECT_FALSE(mine.openExisting(name));
  ASSERT_EQ(mine.create(name, 0644, 1), 0);
  EXPECT_TRUE(mine.openExisting(name));  // closing it after create did not remove it
  EXPECT_TRUE(LinuxNamedSemaphores(first.root()).openExisting(name));
  EXPECT_FALSE(theirs.openExisting(name));
  EXPECT_EQ(mine.create(name, 0644, 1), 0);  // creating an existing mark is fine

  mine.remove(name);
  EXPECT_FALSE(mine.openExisting(name));
  mine.remove(name);  // removing again is harmless

  // A failure reports its errno.
  EXPECT_EQ(mine.create("not/a/name", 0644, 1), EINVAL);
  EXPECT_FALSE(mine.openExisting("not/a/name"));
}

}  // namespace
}  // namespace kestrel::platform
