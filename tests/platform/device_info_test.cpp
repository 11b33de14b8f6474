#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "platform/linux/device_info_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

using testing::ScratchRoot;

TEST(DeviceInfoTest, InternalBuildIsTheMarkersExistenceWhateverItsType) {
  const std::string marker = "/etc/kestrel/internal-build";
  {
    ScratchRoot scratch;
    EXPECT_FALSE(LinuxDeviceInfo(scratch.root()).isInternalBuild());
  }
  {
    SCOPED_TRACE("dangling symlink");
    ScratchRoot scratch;
    std::filesystem::create_directories(scratch.resolve("/etc/kestrel"));
    ASSERT_EQ(::symlink("nowhere", scratch.resolve(marker).c_str()), 0);
    EXPECT_TRUE(LinuxDeviceInfo(scratch.root()).isInternalBuild());
  }
}

TEST(DeviceInfoTest, BuildVersionPrefersBuildIdThenVersionIdThenUnknown) {
  struct Row {
    const char* label;
    const char* osRelease;  // nullptr: no file
    const char* expected;
  };
  const Row rows[] = {
      {"no file", nullptr, "Unknown"},
      {"neither key", "NAME=Kestrel\nID=kestrel\n", "Unknown"},
      {"version only", "NAME=Kestrel\nVERSION_ID=12.1\n", "12.1"},
      {"both", "VERSION_ID=12.1\nBUILD_ID=21A5248v\n", "21A5248v"},
      {"empty build id", "BUILD_ID=\"\"\nVERSION_ID=12.1\n", "12.1"},
      {"escapes", "BUILD_ID=\"say \\\"hi\\\" \\$x\"\n", "say \"hi\" $x"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    ScratchRoot scratch;
    if (row.osRelease != nullptr) scratch.writeFile("/etc/os-release", row.osRelease);
    EXPECT_EQ(LinuxDeviceInfo(scratch.root()).buildVersion(), row.expected);
  }
}

}  // namespace
}  // namespace kestrel::platform
