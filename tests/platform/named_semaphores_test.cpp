#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <regex>
#include <string>

#include "platform/linux/named_semaphores_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using testing::ScratchRoot;

// Unlinks the semaphore when the test ends, however it ends.
class RemoveOnExit {
 public:
  RemoveOnExit(NamedSemaphores& semaphores, std::string name)
      : semaphores_(semaphores), name_(std::move(name)) {}
  ~RemoveOnExit() { semaphores_.remove(name_); }
  RemoveOnExit(const RemoveOnExit&) = delete;
  RemoveOnExit& operator=(const RemoveOnExit&) = delete;

 private:
  NamedSemaphores& semaphores_;
  std::string name_;
};

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
  RemoveOnExit cleanupMine(mine, name);
  RemoveOnExit cleanupTheirs(theirs, name);

  EXPECT_FALSE(mine.openExisting(name));
  ASSERT_EQ(mine.create(name, 0644, 1), 0);
  EXPECT_TRUE(mine.openExisting(name));  // closing it after create did not remove it
  EXPECT_TRUE(LinuxNamedSemaphores(first.root()).openExisting(name));
  EXPECT_FALSE(theirs.openExisting(name));
  EXPECT_EQ(mine.create(name, 0644, 1), 0);  // creating an existing mark is fine

  mine.remove(name);
  EXPECT_FALSE(mine.openExisting(name));
  mine.remove(name);  // removing again is harmless
}

TEST(NamedSemaphoresTest, CreateReportsTheErrnoOfAFailure) {
  ScratchRoot scratch;
  LinuxNamedSemaphores semaphores(scratch.root());
  EXPECT_EQ(semaphores.create("not/a/name", 0644, 1), EINVAL);
  EXPECT_FALSE(semaphores.openExisting("not/a/name"));
}

}  // namespace
}  // namespace kestrel::platform
