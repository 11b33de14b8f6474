// Disk usage: what the walk counts in trees built for the purpose, and which
// containers keep their figure in their info dictionary.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "daemon/error_codes.h"
#include "store/file_manager.h"
#include "support/store_test_helpers.h"
#include "support/tmpfs_mount.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kStaticDiskUsageKey = "com.zorvane.Tessel.StaticDiskUsage";

std::uint64_t allocated(const std::string& path) {
  return testing::statOf(path).st_blocks * 512;
}

// Writes a file of `bytes` bytes and gives the storage allocated to it.
std::uint64_t writeFile(const std::string& path, std::size_t bytes) {
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream(path) << std::string(bytes, 'x');
  return allocated(path);
}

using DiskUsageTest = testing::StoreTest;

TEST_F(DiskUsageTest, TheWalkCountsEachFileOnceAndNothingOutsideTheTree) {
  const std::string outside = fakes.scratch.path() + "/outside";
  const std::uint64_t large = writeFile(outside + "/large", 1 << 20);
  ASSERT_GT(large, 0u);
  std::vector<std::unique_ptr<testing::TmpfsMount>> mounts;

  const struct {
    const char* label;
    // Builds the tree at the path and gives the usage expected of it.
    std::function<std::uint64_t(const std::string&)> build;
  } rows[] = {
      {"empty tree",
       [](const std::string& tree) -> std::uint64_t {
         fs::create_directories(tree + "/a/b/c");
         return 0;
       }},
      {"files at several depths",
       [](const std::string& tree) {
         return writeFile(tree + "/one", 10) + writeFile(tree + "/a/two", 5000) +
                writeFile(tree + "/a/b/three", 70000);
       }},
      {"two hard links count once",
       [](const std::string& tree) {
         const std::uint64_t bytes = writeFile(tree + "/a/file", 9000);
         fs::create_hard_link(tree + "/a/file", tree + "/b/link");
         return bytes;
       }},
      {"a link to a large file outside counts as the link only",
       [&](const std::string& tree) {
         fs::create_directories(tree);
         fs::create_symlink(outside + "/large", tree + "/link");
         fs::create_directory_symlink(outside, tree + "/dirlink");
         return allocated(tree + "/link") + allocated(tree + "/dirlink");
       }},
      {"a file system mounted inside adds nothing",
       [&](const std::string& tree) {
         const std::uint64_t bytes = writeFile(tree + "/own", 3000);
         mounts.push_back(std::make_unique<testing::TmpfsMount>(tree + "/mounted"));
         EXPECT_TRUE(mounts.back()->mounted()) << mounts.back()->error();
         writeFile(tree + "/mounted/large", 1 << 20);
         return bytes;
       }},
  };
  int n = 0;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.label);
    const std::string tree = fakes.scratch.path() + "/tree" + std::to_string(n++);
    fs::create_directories(tree + "/b");
    const std::uint64_t expected = row.build(tree);
    EXPECT_EQ(KSTFileManager::defaultManager().diskUsageForURL(KSTFileURL(tree, true)), expected);
  }
  EXPECT_EQ(KSTFileManager::defaultManager().diskUsageForURL(KSTFileURL(outside + "/none", true)),
            0u);
  EXPECT_TRUE(fakes.logged("Failed to open directory " + outside + "/none : "));
}

TEST_F(DiskUsageTest, BundleFiguresAreKeptUntilTheirInfoValueGoesAndDataFiguresNeverAre) {
  const KSTMetadataRef bundle = make(33, 1, "com.example.app");
  const KSTMetadataRef data = make(501, 2, "com.example.app");
  ASSERT_TRUE(bundle && data);
  const auto usage = [&](const KSTMetadataRef& container) {
    std::uint64_t code = kKSTSuccess;
    const std::uint64_t bytes = installer.diskUsageForUserId(
        container->uid(), container->uuid(), "com.example.app", container->containerClass(), &code);
    EXPECT_EQ(code, kKSTSuccess);
    return bytes;
  };
  // The metadata file lies in the container and counts too.
  const auto metadataFile = [](const KSTMetadataRef& container) {
    return allocated(container->url().path() + "/.com.zorvane.kestrel.metadata.plist");
  };
  const auto kept = [&](const KSTMetadataRef& container) -> std::optional<PlistValue> {
    std::uint64_t code = kKSTSuccess;
    return installer.infoValueForKey(kStaticDiskUsageKey, container->uid(), container->uuid(),
                                     "com.example.app", container->containerClass(), true, &code);
  };

  const std::uint64_t first = writeFile(bundle->url().path() + "/App/binary", 20000);
  const std::uint64_t measured = first + metadataFile(bundle);
  EXPECT_EQ(usage(bundle), measured);
  EXPECT_EQ(kept(bundle), PlistValue(measured));
  // Not walked again: a file added since is not seen...
  const std::uint64_t second = writeFile(bundle->url().path() + "/App/resource", 40000);
  EXPECT_EQ(usage(bundle), measured);
  // ...until the kept figure is removed.
  std::uint64_t code = kKSTSuccess;
  installer.setInfoValue(std::nullopt, kStaticDiskUsageKey, 33, bundle->uuid(), "com.example.app",
                         1, true, &code);
  const std::uint64_t remeasured = first + second + metadataFile(bundle);
  EXPECT_EQ(usage(bundle), remeasured);
  EXPECT_EQ(kept(bundle), PlistValue(remeasured));

  const std::uint64_t document = writeFile(data->url().path() + "/Documents/a", 30000);
  EXPECT_EQ(usage(data), document + metadataFile(data));
  const std::uint64_t more = writeFile(data->url().path() + "/Documents/b", 30000);
  EXPECT_EQ(usage(data), document + more + metadataFile(data));
  EXPECT_FALSE(kept(data));
}

}  // namespace
}  // namespace kestrel
