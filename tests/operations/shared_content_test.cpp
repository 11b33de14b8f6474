// Shared-content staging: its refusals, a move with the ACL reset, and a path
// component flipped to a link to the outside while requests go through it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <stdio.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <map>
#include <thread>

#include "codesigning/code_signing_mapping.h"
#include "daemon/error_codes.h"
#include "platform/linux/extended_acl_linux.h"
#include "platform/unique_fd.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kGroup = "systemgroup.com.example.shared";

class SharedContentTest : public testing::StoreTest {
 protected:
  SharedContentTest() {
    // The ACLs as the kernel enforces them.
    fakes.services.extendedACL = std::make_shared<platform::LinuxExtendedACL>(fakes.accounts);
    fakes.install();
    const PlistDictionary entitlements{
        {kKSTSystemGroupsEntitlement, PlistArray{kGroup, "systemgroup.com.example.none"}}};
    EXPECT_EQ(
        testing::storeEntries(KSTCodeSigningMapping::sharedInstance(),
                              {KSTCodeSigningEntry(testing::infoWithEntitlements(entitlements), 2)},
                              {"com.example.stager"}),
        nullptr);
    container = make(499, 13, kGroup)->url().path();
    fs::create_directories(container + "/in/sub");
    std::ofstream(container + "/in/sub/file") << "inside";
    fs::create_directories(outside);
    std::ofstream(outside + "/file") << "outside";
  }
  std::uint64_t stage(const std::optional<std::string>& identifier, const std::string& source,
                      const std::string& dest, std::optional<std::string>* path = nullptr) {
    std::uint64_t code = kKSTSuccess;
    const auto staged = stager.stageSharedContentForIdentifier(identifier, source, dest, &code);
    if (path != nullptr) *path = staged ? std::optional(staged->path()) : std::nullopt;
    return code;
  }

  KSTClientConnection stager{std::string("com.example.stager"), 0, false, std::nullopt};
  std::string container;
  const std::string outside = fakes.scratch.resolve("/private/var/outside");
};

TEST_F(SharedContentTest, RefusalsAndAMoveWithItsACLReset) {
  fs::create_symlink(outside, container + "/in/escape");
  struct Row {
    const char* label;
    std::optional<std::string> identifier;
    std::string source, dest;
    std::uint64_t code;
  } rows[] = {
      {"no identifier", std::nullopt, "in/sub/file", "moved", kKSTErrorInvalidObject},
      {"dot-dot", kGroup, "in/../in/sub/file", "moved", kKSTErrorInvalidParameter},
      {"not entitled", "systemgroup.com.example.other", "in/sub/file", "moved",
       kKSTErrorNotEntitled},
      {"no such container", "systemgroup.com.example.none", "in/sub/file", "moved",
       kKSTErrorNotFound},
      {"source through a link out", kGroup, "in/escape/file", "moved", kKSTErrorInvalidURL},
      {"destination through a link out", kGroup, "in/sub/file", "in/escape/moved",
       kKSTErrorInvalidURL},
      {"the container itself", kGroup, ".", "moved", kKSTErrorInvalidURL},
      {"no source", kGroup, "in/sub/none", "moved", kKSTErrorACLFailed},
      {"no destination directory", kGroup, "in/sub/file", "in/none/moved",
       kKSTErrorSharedContentMoveFailed},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    EXPECT_EQ(stage(row.identifier, row.source, row.dest), row.code);
    EXPECT_EQ(fakes.scratch.readFile(outside.substr(fakes.scratch.path().size()) + "/file"),
              "outside");
  }

  std::optional<std::string> path;
  ASSERT_EQ(stage(kGroup, "in/sub", "staged", &path), kKSTSuccess);
  EXPECT_EQ(path, container + "/staged");
  EXPECT_EQ(fakes.scratch.readFile(path->substr(fakes.scratch.path().size()) + "/file"), "inside");
  for (const std::string& item : {*path, *path + "/file"}) {
    SCOPED_TRACE(item);
    EXPECT_EQ(testing::modeOf(item) & 0707, 0u);  // the group bits are the list's mask
    EXPECT_EQ(testing::ownerOf(item), 4294967294u);
    EXPECT_NE(testing::aclText(item, ACL_TYPE_ACCESS).find("group:499:rwx"), std::string::npos);
  }
}

// One thread swaps "in/sub" between a directory and a link to a directory
// outside the container while requests stage "in/sub/file" through it: each
// request moves the file within, or is refused; nothing outside is ever moved
// or changed.
TEST_F(SharedContentTest, AComponentSwappedForALinkNeverLeadsOutside) {
  const std::string in = container + "/in";
  fs::create_symlink(outside, in + "/other");
  const platform::UniqueFd directory(::open(in.c_str(), O_PATH | O_DIRECTORY));
  const platform::UniqueFd real(::open((in + "/sub").c_str(), O_PATH | O_DIRECTORY));
  ASSERT_TRUE(directory && real);
  struct stat before {};
  ASSERT_EQ(::lstat((outside + "/file").c_str(), &before), 0);

  std::atomic<bool> stop{false};
  std::thread flipper([&] {
    while (!stop) {
      ::renameat2(directory.get(), "sub", directory.get(), "other", RENAME_EXCHANGE);
    }
  });
  std::map<std::uint64_t, int> outcomes;
  for (int i = 0; i < 3000; ++i) {
    const std::uint64_t code = stage(kGroup, "in/sub/file", "in/sub/moved");
    ++outcomes[code];
    // Put it back for the next round, in the real directory whatever its name now.
    if (code == kKSTSuccess) ::renameat(real.get(), "moved", real.get(), "file");
  }
  stop = true;
  flipper.join();
  for (const auto& [code, count] : outcomes) {
    SCOPED_TRACE(code);
    EXPECT_TRUE(code == kKSTSuccess || code == kKSTErrorInvalidURL || code == kKSTErrorACLFailed ||
                code == kKSTErrorSharedContentMoveFailed)
        << count;
  }
  EXPECT_GT(outcomes[kKSTSuccess], 0);
  // Outside: the same single file, untouched.
  EXPECT_EQ(testing::namesIn(outside), std::vector<std::string>{"file"});
  struct stat after {};
  ASSERT_EQ(::lstat((outside + "/file").c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mode, before.st_mode);
  EXPECT_EQ(after.st_uid, before.st_uid);
  EXPECT_EQ(after.st_ctim.tv_sec, before.st_ctim.tv_sec);
  EXPECT_EQ(after.st_ctim.tv_nsec, before.st_ctim.tv_nsec);
  EXPECT_EQ(::lgetxattr((outside + "/file").c_str(), "trusted.kestrel.acl", nullptr, 0), -1);
}

}  // namespace
}  // namespace kestrel
