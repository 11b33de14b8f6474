#include "daemon/log.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/linux/logging_linux.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class LogTest : public ::testing::Test {
 protected:
  testing::FakeServices fakes;
};

void writeOneOfEach() {
  KSTLog(kLogError, "error %d", 3);
  KSTLog(kLogNotice, "notice %d", 5);
  KSTLog(kLogDebug, "debug %d", 7);
}

TEST_F(LogTest, LevelsFilterOnlyWhileThereIsAHandle) {
  writeOneOfEach();  // no handle yet: everything goes to the default destination
  EXPECT_EQ(fakes.logging->lines().size(), 3u);
  EXPECT_FALSE(fakes.logging->lines()[0].withHandle);

  fakes.logging->clear();
  ASSERT_TRUE(Log::open("com.zorvane.kestreld", fakes.scratch.path() + "/log", kLogNotice));
  writeOneOfEach();
  auto lines = fakes.logging->lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].message, "error 3");
  EXPECT_EQ(lines[1].message, "notice 5");
  EXPECT_TRUE(lines[1].withHandle);

  fakes.logging->clear();
  Log::setCurrentLevel(kLogError);
  writeOneOfEach();
  EXPECT_EQ(fakes.logging->lines().size(), 1u);

  // A very long message is cut, and says so.
  fakes.logging->clear();
  KSTLog(kLogError, "%@", std::string(Log::kMaxLogMessageBytes + 10, 'x'));
  ASSERT_EQ(fakes.logging->lines().size(), 1u);
  EXPECT_EQ(fakes.logging->lines()[0].message,
            std::string(Log::kMaxLogMessageBytes, 'x') + " ... (10 bytes more)");
}

// The real disk log: one file of 102400 bytes on a customer build, four of
// 262144 on an internal one, rotated by size; or no handle at all.
TEST(LinuxLoggingTest, RotatingLogKeepsTheConfiguredFilesAndSizes) {
  testing::ScratchRoot scratch;
  auto logging = platform::makeLinuxLogging(scratch.root());
  const std::string line(1000, 'x');
  struct Row {
    const char* label;
    std::size_t count;
    std::size_t size;
  } rows[] = {{"customer build", 1, 102400}, {"internal build", 4, 262144}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    const std::string dir = scratch.path() + "/" + row.label + "/Logs";
    const std::string path = dir + "/kestreld.log";
    auto handle = logging->open("com.zorvane.kestreld", path);
    ASSERT_NE(handle, nullptr);
    EXPECT_EQ(fs::status(dir).permissions() & fs::perms::all, fs::perms(0755));
    ASSERT_TRUE(handle->enableDiskLogging(path, row.count, row.size, 0));
    for (int i = 0; i < 1500; ++i) handle->write(kLogNotice, "writer", line);
    handle->flush();
    std::size_t files = 0;
    for (const auto& entry : fs::directory_iterator(dir)) {
      ++files;
      EXPECT_LE(entry.file_size(), row.size) << entry.path();
    }
    EXPECT_EQ(files, row.count);
  }
  // A log that cannot be opened gives no handle.
  scratch.writeFile("/blocker", "a file where a directory should be");
  EXPECT_EQ(logging->open("com.zorvane.kestreld", scratch.resolve("/blocker/Logs/kestreld.log")),
            nullptr);
}

}  // namespace
}  // namespace kestrel
