// realPathForURL: which paths lie within a base once links and the
// "/private" alias are resolved, over layouts a client could build.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "store/file_manager.h"
#include "store/plist_io.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class PathConfinementTest : public ::testing::Test {
 protected:
  PathConfinementTest() {
    fs::create_directories(base + "/sub/deeper");
    fs::create_directories(outside);
    std::ofstream(base + "/file") << "f";
    std::ofstream(outside + "/secret") << "s";
  }
  std::string sys(const std::string& path) const { return fakes.scratch.resolve(path); }
  std::optional<std::string> check(const std::string& path, const std::string& within) const {
    const auto real =
        KSTFileManager::defaultManager().realPathForURL(KSTFileURL(path), KSTFileURL(within));
    return real ? std::optional(real->path()) : std::nullopt;
  }

  testing::FakeServices fakes;
  const std::string base = sys("/private/var/containers/Shared/SystemGroup/G");
  const std::string outside = sys("/private/var/outside");
};

TEST_F(PathConfinementTest, AcceptsWhatStaysWithinAndSaysWhyItRejectsTheRest) {
  const auto link = [&](const std::string& target, const std::string& at) {
    fs::create_symlink(target, base + "/" + at);
  };
  link("../y", "top-link");                         // escapes from the top level
  link("../file", "sub/up-link");                   // one level deeper: stays within
  link(base + "/file", "absolute-inside");          // absolute, even pointing inside
  link(outside, "to-outside");                      // an absolute link as a component
  link("../../../../outside", "relative-outside");  // a relative one leading out
  link("to-outside/secret", "through-a-link");      // passes by its own components only
  link("loop-b", "loop-a");
  link("loop-a", "loop-b");
  ::mkfifo((base + "/fifo").c_str(), 0600);
  std::string long1024(1024, 'a');
  for (std::size_t i = 1; i < long1024.size(); i += 2) long1024[i] = '/';  // "a/a/a/.../a"
  link(long1024, "sub/long");
  // The system's alias: "<root>/var" is the same tree as "<root>/private/var".
  fs::create_directory_symlink("private/var", sys("/var"));

  struct Row {
    const char* label;
    std::string path;
    std::optional<std::string> real;  // nothing: rejected
    std::string logged;               // a rejection's line, in part
  } rows[] = {
      {"an existing file", base + "/file", base + "/file", ""},
      {"a destination not made yet", base + "/sub/new/name", base + "/sub/new/name", ""},
      {"names that only contain dots", base + "/a..b/...", base + "/a..b/...", ""},
      {"a fifo", base + "/fifo", base + "/fifo", ""},
      {"a relative link one level down", base + "/sub/up-link", base + "/file", ""},
      {"the alias of the same tree", sys("/var/containers/Shared/SystemGroup/G/file"),
       base + "/file", ""},
      {"dot-dot", base + "/sub/../file", std::nullopt, "contains '..' paths, which are invalid"},
      {"outside the base", outside + "/secret", std::nullopt, "does not contain base path"},
      {"a sibling sharing the prefix", base + "X/f", std::nullopt,
       "components diverge"},
      {"an absolute link", base + "/absolute-inside", std::nullopt,
       "as absolute symlinks are not allowed"},
      {"a link escaping from the top", base + "/top-link", std::nullopt,
       "as it is points outside or to the base"},
      {"an absolute link as a component", base + "/to-outside/secret", std::nullopt,
       "base component count is greater than child component count"},
      {"a relative link as a component", base + "/relative-outside/secret", std::nullopt,
       "base component count is greater than child component count"},
      {"a link that passes but leads out through another", base + "/through-a-link", std::nullopt,
       "base component count is greater than child component count"},
      {"a loop", base + "/loop-a", std::nullopt, "Failed to retrieve realpath for suspicious path"},
      {"a file as a directory", base + "/file/x", std::nullopt, "Readlink failed: Not a directory"},
      // Read whole, and bounded: it names a place within that does not exist yet.
      {"a link target of 1024 bytes", base + "/sub/long", base + "/sub/long", ""},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    fakes.logging->clear();
    EXPECT_EQ(check(row.path, base), row.real);
    if (!row.logged.empty()) {
      EXPECT_TRUE(fakes.logged(row.logged));
    }
  }
  EXPECT_EQ(check(base + "/file", ""), std::nullopt);
  EXPECT_TRUE(fakes.logged("The base path  and/or suspicious path"));
  EXPECT_TRUE(KSTContainsDotDotPathComponents("a/../b"));
  EXPECT_FALSE(KSTContainsDotDotPathComponents("a/..b/c.."));
}

}  // namespace
}  // namespace kestrel
