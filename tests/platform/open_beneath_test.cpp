#include "platform/linux/open_beneath_linux.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "platform/unique_fd.h"
#include "support/scratch_root.h"
#include "support/tmpfs_mount.h"

namespace kestrel::platform {
namespace {

namespace fs = std::filesystem;

// Both ways of opening beneath a directory over one layout: openat2, and the
// walk by names used where openat2 is refused. The walk may refuse more (any
// link, any ".."), never less.
TEST(OpenBeneathTest, NeitherWayLeavesTheBaseAndTheWalkFollowsNoLink) {
  testing::ScratchRoot scratch;
  const std::string base = scratch.path() + "/base";
  fs::create_directories(base + "/dir/sub");
  fs::create_directories(scratch.path() + "/outside/sub");
  fs::create_directory_symlink("dir", base + "/inner");
  fs::create_directory_symlink("../outside", base + "/escaping");
  fs::create_directory_symlink(scratch.path() + "/outside", base + "/absolute");
  fs::create_directory_symlink("/proc/self/cwd", base + "/magic");
  testing::TmpfsMount mount(base + "/mnt");
  ASSERT_TRUE(mount.mounted()) << mount.error();
  fs::create_directory(base + "/mnt/sub");
  const UniqueFd baseFd(::open(base.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(baseFd);

  constexpr int kOpened = 0;
  struct Case {
    const char* path;
    int withOpenat2;  // kOpened, or the errno
    int byNames;
  } const cases[] = {
      {"", kOpened, kOpened},
      {"dir/sub", kOpened, kOpened},
      {"./dir//sub/", kOpened, kOpened},
      {"dir/../dir", kOpened, EXDEV},
      {"inner/sub", kOpened, ELOOP},
      {"..", EXDEV, EXDEV},
      {"escaping/sub", EXDEV, ELOOP},
      {"absolute/sub", EXDEV, ELOOP},
      {"magic", EXDEV, ELOOP},
      {"mnt/sub", EXDEV, EXDEV},
      {"mnt", EXDEV, EXDEV},
      {"missing/sub", ENOENT, ENOENT},
  };
  const auto outcome = [&](auto open, const char* path) {
    int fd = -1;
    const int error = open(baseFd.get(), path, O_RDONLY | O_DIRECTORY, &fd);
    const UniqueFd opened(fd);
    EXPECT_EQ(error == 0, opened.get() >= 0) << path;
    return error;
  };
  for (const Case& c : cases) {
    const int openat2 = outcome(openBeneathWithOpenat2, c.path);
    if (openat2 != ENOSYS) {
      EXPECT_EQ(openat2, c.withOpenat2) << '"' << c.path << '"';
    }
    EXPECT_EQ(outcome(openBeneathByNames, c.path), c.byNames) << '"' << c.path << '"';
  }
}

}  // namespace
}  // namespace kestrel::platform
