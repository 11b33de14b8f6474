#include "store/file_manager.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/acl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>

#include "daemon/log.h"
#include "platform/data_protection.h"
#include "platform/file_system.h"
#include "platform/linux/extended_acl_linux.h"
#include "platform/unique_fd.h"
#include "support/store_test_helpers.h"
#include "support/tmpfs_mount.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::aclText;
using testing::isPOSIXError;
using testing::Match;
using testing::messageOf;
using testing::statOf;

class FileManagerTest : public ::testing::Test {
 protected:
  ~FileManagerTest() override {
    for (const std::string& path : immutable_) platform::lchflags(path.c_str(), 0);
  }
  std::string path(const std::string& relative) const {
    return fakes.scratch.path() + "/" + relative;
  }
  KSTFileURL url(const std::string& relative, bool isDirectory = false) const {
    return KSTFileURL(path(relative), isDirectory);
  }
  // A file with its parents; the owner is set before the mode, which keeps set-uid.
  void makeFile(const std::string& relative, std::string_view contents = "", mode_t mode = 0644,
                uid_t uid = 0, gid_t gid = 0) {
    fs::create_directories(fs::path(path(relative)).parent_path());
    std::ofstream(path(relative), std::ios::binary) << contents;
    ASSERT_EQ(::chown(path(relative).c_str(), uid, gid), 0);
    ASSERT_EQ(::chmod(path(relative).c_str(), mode), 0);
  }
  void makeImmutable(const std::string& relative) {
    ASSERT_EQ(platform::lchflags(path(relative).c_str(), platform::kFileFlagUserImmutable), 0);
    immutable_.push_back(path(relative));
  }
  static std::string attribute(const std::string& file, const char* name) {
    char buffer[256];
    const ssize_t n = ::lgetxattr(file.c_str(), name, buffer, sizeof buffer);
    return n < 0 ? "<none>" : std::string(buffer, static_cast<std::size_t>(n));
  }
  static void setAcl(const std::string& file, acl_type_t type, const char* text) {
    const platform::UniquePosixACL acl(acl_from_text(text));
    ASSERT_TRUE(acl) << text;
    ASSERT_EQ(acl_set_file(file.c_str(), type, acl.get()), 0) << text;
  }

  testing::FakeServices fakes;
  const KSTFileManager& manager = KSTFileManager::defaultManager();

 private:
  std::vector<std::string> immutable_;
};

TEST_F(FileManagerTest, RemovalTakesTheTreeAndItsLockedFilesButNothingItsLinksPointTo) {
  makeFile("tree/a", "a");
  makeFile("tree/sub/locked", "x");
  makeImmutable("tree/sub/locked");
  makeFile("outside/keep", "keep");
  ASSERT_EQ(::symlink(path("outside").c_str(), path("tree/sub/dirlink").c_str()), 0);
  ASSERT_EQ(::symlink(path("outside/keep").c_str(), path("filelink").c_str()), 0);
  KSTErrorRef error;
  EXPECT_TRUE(manager.removeItemAtURL(url("tree", true), &error)) << messageOf(error);
  EXPECT_TRUE(manager.removeItemAtURL(url("filelink"), &error)) << messageOf(error);
  EXPECT_TRUE(manager.removeItemAtURL(url("never-there"), &error));
  EXPECT_FALSE(fakes.scratch.exists("/tree"));
  EXPECT_FALSE(fakes.scratch.exists("/filelink"));
  EXPECT_EQ(fakes.scratch.readFile("/outside/keep"), "keep");
  EXPECT_TRUE(fakes.logging->contains("_treeremove_error_callback",
                                      "Unset UF_IMMUTABLE on " + path("tree/sub/locked")));
  EXPECT_TRUE(fakes.logging->containsMessage("treeremove hit error for " + path("tree/sub/locked") +
                                             " : Operation not permitted"));
}

TEST_F(FileManagerTest, RemovalTakesWhatArrivesInADirectoryAfterItWasRead) {
  // The walk lists "holder", then spends a while emptying "holder/slow";
  // meanwhile (at its first removal there) an item is renamed into "holder",
  // as items arrive in the holders of death row while a sweep runs.
  for (int i = 0; i < 2000; ++i) makeFile("holder/slow/" + std::to_string(i));
  makeFile("late", "late");
  const platform::UniqueFd watch(::inotify_init1(IN_CLOEXEC));
  ASSERT_TRUE(watch);
  ASSERT_GE(::inotify_add_watch(watch.get(), path("holder/slow").c_str(), IN_DELETE), 0);
  bool arrived = false;
  std::thread arrival([&] {
    alignas(inotify_event) char buffer[4096];
    pollfd ready{watch.get(), POLLIN, 0};
    if (::poll(&ready, 1, 10000) == 1 && ::read(watch.get(), buffer, sizeof buffer) > 0) {
      arrived = ::rename(path("late").c_str(), path("holder/late").c_str()) == 0;
    }
  });
  KSTErrorRef error;
  EXPECT_TRUE(manager.removeItemAtURL(url("holder", true), &error)) << messageOf(error);
  arrival.join();
  EXPECT_TRUE(arrived);
  EXPECT_FALSE(fakes.scratch.exists("/holder"));
}

TEST_F(FileManagerTest, RemovalReportsTheFirstErrorAndGoesOnAndMovesNeedTheirSource) {
  // The entries of an immutable or append-only directory go once it lost the
  // flag. A mount point cannot go (EBUSY, first), which leaves its directory
  // non-empty (ENOTEMPTY, later); the rest is removed.
  makeFile("tree/frozen/file");
  makeFile("tree/appending/file");
  makeImmutable("tree/frozen");
  ASSERT_EQ(platform::lchflags(path("tree/appending").c_str(), platform::kFileFlagAppend), 0);
  makeFile("tree/held/mnt/.keep");
  testing::TmpfsMount mount(path("tree/held/mnt"));
  ASSERT_TRUE(mount.mounted()) << mount.error();
  KSTErrorRef error;
  EXPECT_FALSE(manager.removeItemAtURL(url("tree", true), &error));
  EXPECT_TRUE(isPOSIXError(error, EBUSY,
                           "treeremove of " + path("tree") + " failed: Device or resource busy"));
  EXPECT_FALSE(fakes.scratch.exists("/tree/frozen"));
  EXPECT_FALSE(fakes.scratch.exists("/tree/appending"));
  EXPECT_TRUE(fakes.scratch.exists("/tree/held/mnt"));

  EXPECT_FALSE(manager.removeItemAtURL(KSTFileURL(), &error));
  EXPECT_TRUE(isPOSIXError(error, EFAULT, "nil url passed to -removeItemAtURL:error:"));
  EXPECT_TRUE(manager.moveItemIfExistsAtURL(url("never-there"), url("there"), &error));
  EXPECT_FALSE(manager.moveItemAtURL(url("never-there"), url("there"), &error));
  EXPECT_EQ(messageOf(error), "rename of " + path("never-there") + " to " + path("there") +
                                  " failed: No such file or directory");
}

// Across file systems a move is a copy and a removal; a move that fails
// leaves nothing at the destination.
TEST_F(FileManagerTest, MoveAcrossFileSystemsSucceedsWholeOrLeavesNothingThere) {
  testing::TmpfsMount other(path("other"), 256 * 1024);
  ASSERT_TRUE(other.mounted()) << other.error();
  // The copy keeps owners, modes and the protection class.
  makeFile("plain/sub/a", "a", 0600, 501, 501);
  const std::string protection("\x01\0\0\0", 4);
  ASSERT_EQ(::setxattr(path("plain/sub/a").c_str(), platform::kProtectionClassAttribute,
                       protection.data(), 4, 0),
            0);
  KSTErrorRef error;
  EXPECT_TRUE(manager.moveItemAtURL(url("plain", true), url("other/plain", true), &error))
      << messageOf(error);
  EXPECT_FALSE(fakes.scratch.exists("/plain"));
  EXPECT_EQ(fakes.scratch.readFile("/other/plain/sub/a"), "a");
  EXPECT_EQ(testing::ownerOf(path("other/plain/sub/a")), 501u);
  EXPECT_EQ(testing::modeOf(path("other/plain/sub/a")), 0600u);
  EXPECT_EQ(attribute(path("other/plain/sub/a"), platform::kProtectionClassAttribute), protection);

  // The copy runs out of room half-way: the part copied goes again.
  makeFile("big/1", std::string(200 * 1024, 'x'));
  makeFile("big/2", std::string(200 * 1024, 'y'));
  EXPECT_FALSE(manager.moveItemAtURL(url("big", true), url("other/big", true), &error));
  EXPECT_TRUE(isPOSIXError(error, ENOSPC));
  EXPECT_FALSE(fakes.scratch.exists("/other/big"));
  EXPECT_TRUE(fakes.scratch.exists("/big/2"));

  // The source cannot be removed: the move fails with that, and its copy goes.
  makeFile("held/mnt/.keep");
  testing::TmpfsMount mount(path("held/mnt"));
  ASSERT_TRUE(mount.mounted()) << mount.error();
  EXPECT_FALSE(manager.moveItemAtURL(url("held", true), url("other/held", true), &error));
  EXPECT_TRUE(isPOSIXError(error, EBUSY));
  EXPECT_FALSE(fakes.scratch.exists("/other/held"));
  EXPECT_TRUE(fakes.logging->contains(
      "_moveItemAtURL", "Failed to remove source " + path("held") + " : Device or resource busy"));
  // An item in the way is not taken for a partial copy.
  makeFile("other/taken/mine", "mine");
  makeFile("taken/theirs");
  EXPECT_FALSE(manager.moveItemAtURL(url("taken", true), url("other/taken", true), &error));
  EXPECT_TRUE(isPOSIXError(error, EEXIST));
  EXPECT_EQ(fakes.scratch.readFile("/other/taken/mine"), "mine");
}

TEST_F(FileManagerTest, NewDirectoryGetsModeOwnerAndClassAnExistingOneKeepsItsMode) {
  KSTErrorRef error;
  ASSERT_TRUE(manager.createDirectoryAtURL(url("a/b/c", true), true, 0750, 501,
                                           KSTProtectionClass{0}, &error))
      << messageOf(error);
  EXPECT_EQ(testing::modeOf(path("a")), 0750u);
  EXPECT_EQ(testing::modeOf(path("a/b/c")), 0750u);
  EXPECT_EQ(statOf(path("a/b/c")).st_gid, 501u);
  EXPECT_EQ(testing::protectionClassOf(path("a/b/c")), 0);
  // Owner 0 and class -1 leave both alone.
  ASSERT_TRUE(manager.createDirectoryAtURL(url("plain", true), false, 0755, &error));
  EXPECT_EQ(testing::ownerOf(path("plain")), 0u);
  EXPECT_EQ(testing::protectionClassOf(path("plain")), std::nullopt);
  ASSERT_TRUE(manager.createDirectoryAtURL(url("a", true), false, 0755, 502, KSTProtectionClass{3},
                                           &error));
  EXPECT_EQ(testing::modeOf(path("a")), 0750u);
  EXPECT_EQ(testing::ownerOf(path("a")), 502u);
  EXPECT_EQ(testing::protectionClassOf(path("a")), 3);

  makeFile("file");
  const std::tuple<std::string, bool, bool, int, std::string> rows[] = {
      {"no/such", false, false, ENOENT,
       "mkdir of " + path("no/such") + " failed: No such file or directory"},
      {"file/sub", true, false, ENOTDIR,
       "makepath of " + path("file/sub") + " failed: Not a directory"},
      {"a", true, true, EPERM,  // class while locked
       "Failed to setclass(1) on directory " + path("a") + ": Operation not permitted"},
  };
  for (const auto& [relative, parents, locked, code, message] : rows) {
    SCOPED_TRACE(relative);
    fakes.keyBag->setLockState(locked ? 1 : 0);
    EXPECT_FALSE(manager.createDirectoryAtURL(url(relative, true), parents, 0755, 501,
                                              KSTProtectionClass{1}, &error));
    EXPECT_TRUE(isPOSIXError(error, code, message));
  }
}

TEST_F(FileManagerTest, CopyKeepsDataModesOwnersAttributesAclsAndLinksAndRefusesBadTargets) {
  makeFile("src/file", "hello", 0640, 501, 502);
  makeFile("src/tool", "#!/bin/sh\n", 04755, 501, 501);
  makeFile("src/sub/deep", "deep", 0600);
  ASSERT_EQ(::chown(path("src").c_str(), 502, 502), 0);
  ASSERT_EQ(::chmod(path("src").c_str(), 0750), 0);
  ASSERT_EQ(::symlink("file", path("src/link").c_str()), 0);
  ASSERT_EQ(::lchown(path("src/link").c_str(), 502, 502), 0);
  for (const char* name : {"user.note", "trusted.kestrel.protection-class"}) {
    ASSERT_EQ(::setxattr(path("src/file").c_str(), name, "v1", 2, 0), 0);
    ASSERT_EQ(::setxattr(path("src").c_str(), name, "v2", 2, 0), 0);
  }
  setAcl(path("src/file"), ACL_TYPE_ACCESS, "u::rw-,u:503:r--,g::r--,m::r--,o::---");
  setAcl(path("src"), ACL_TYPE_DEFAULT, "u::rwx,u:501:rwx,g::r-x,m::rwx,o::---");
  KSTErrorRef error;
  ASSERT_TRUE(manager.copyItemAtURL(url("src", true), url("dst", true), &error))
      << messageOf(error);

  for (const char* relative : {"", "/file", "/tool", "/sub", "/sub/deep", "/link"}) {
    SCOPED_TRACE(relative);
    const struct stat from = statOf(path("src") + relative), to = statOf(path("dst") + relative);
    EXPECT_EQ(to.st_mode, from.st_mode);
    EXPECT_EQ(to.st_uid, from.st_uid);
    EXPECT_EQ(to.st_gid, from.st_gid);
    EXPECT_EQ(to.st_mtim.tv_sec, from.st_mtim.tv_sec);
  }
  EXPECT_EQ(fakes.scratch.readFile("/dst/file"), "hello");
  EXPECT_EQ(fakes.scratch.readFile("/dst/sub/deep"), "deep");
  EXPECT_EQ(fs::read_symlink(path("dst/link")), "file");
  for (const char* name : {"user.note", "trusted.kestrel.protection-class"}) {
    EXPECT_EQ(attribute(path("dst/file"), name), "v1") << name;
    EXPECT_EQ(attribute(path("dst"), name), "v2") << name;
  }
  EXPECT_EQ(aclText(path("dst/file"), ACL_TYPE_ACCESS), aclText(path("src/file"), ACL_TYPE_ACCESS));
  EXPECT_EQ(aclText(path("dst"), ACL_TYPE_DEFAULT), aclText(path("src"), ACL_TYPE_DEFAULT));
  EXPECT_NE(aclText(path("dst"), ACL_TYPE_DEFAULT).find("user:501:rwx"), std::string::npos);

  // From, to, whether a missing source fails, and the error (0: success).
  const std::tuple<std::string, std::string, bool, int> rows[] = {
      {"src", "dst", true, EEXIST}, {"absent", "copy", false, 0}, {"src", "src/in", true, EINVAL}};
  for (const auto& [from, to, failIfMissing, code] : rows) {
    SCOPED_TRACE(to);
    EXPECT_EQ(manager._copyItemAtURL(url(from), url(to), failIfMissing, &error), code == 0);
    if (code == 0) continue;
    EXPECT_TRUE(isPOSIXError(error, code));
    EXPECT_TRUE(messageOf(error).starts_with("copytree of " + path(from) + " to " + path(to) +
                                             " failed: "));
  }
  EXPECT_FALSE(fakes.scratch.exists("/copy"));
  EXPECT_EQ(fakes.scratch.readFile("/dst/file"), "hello");
}

TEST_F(FileManagerTest, TemporaryDirectoryIsPrivateAndOwned) {
  KSTErrorRef error = KST_POSIX_ERROR(EIO, "left over");
  const auto owned = manager.createTemporaryDirectoryInDirectoryURL(url("", true), 501, &error);
  ASSERT_TRUE(owned);
  EXPECT_FALSE(error);  // Cleared on entry.
  EXPECT_TRUE(owned->lastPathComponent().starts_with("temp."));
  EXPECT_EQ(testing::modeOf(owned->path()), 0700u);
  EXPECT_EQ(testing::ownerOf(owned->path()), 501u);
  EXPECT_FALSE(manager.createTemporaryDirectoryInDirectoryURL(url("absent", true), &error));
  EXPECT_EQ(messageOf(error), "Failed to create temp dir at path " + path("absent/temp.XXXXXX") +
                                  " : No such file or directory");
}

TEST_F(FileManagerTest, ListingSkipsHiddenItemsMarksDirectoriesAndSaysWhyItFailed) {
  makeFile("dir/file");
  makeFile("dir/.hidden");
  makeFile("dir/.com.zorvane.kestrel.metadata.plist");
  makeFile("dir/sub/inner");
  makeFile("hidden-only/.only");
  ASSERT_EQ(::symlink(path("dir/sub").c_str(), path("dir/link").c_str()), 0);
  KSTErrorRef error;
  auto urls = manager.urlsForItemsInDirectoryAtURL(url("dir", true), &error);
  ASSERT_TRUE(urls) << messageOf(error);
  std::sort(urls->begin(), urls->end());
  // A link to a directory is not one.
  EXPECT_EQ(*urls, (std::vector{url("dir/file"), url("dir/link"), url("dir/sub", true)}));
  for (const KSTFileURL& listed : *urls) {
    EXPECT_EQ(listed.isDirectory(), listed.path() == path("dir/sub")) << listed.path();
  }
  urls = manager.urlsForItemsInDirectoryAtURL(url("hidden-only", true), &error);
  ASSERT_TRUE(urls);
  EXPECT_TRUE(urls->empty());

  fakes.logging->clear();
  EXPECT_FALSE(manager.urlsForItemsInDirectoryAtURL(url("absent", true), &error));
  EXPECT_EQ(messageOf(error),
            "_IterateDirectory for " + path("absent") + " returned No such file or directory");
  EXPECT_TRUE(fakes.logging->lines().empty());  // a missing directory is not logged
  EXPECT_FALSE(manager.urlsForItemsInDirectoryAtURL(url("dir/file"), &error));
  EXPECT_TRUE(fakes.logging->contains(
      "_IterateDirectory", "opendir of " + path("dir/file") + " failed: Not a directory"));
}

TEST_F(FileManagerTest, ExistenceIsDecidedWithoutFollowingLinks) {
  makeFile("file");
  ASSERT_EQ(::symlink(path("absent").c_str(), path("dangling").c_str()), 0);
  const std::tuple<const char*, bool, bool> rows[] = {
      {"file", true, false},
      {"absent", false, true},
      {"dangling", true, false},
      {"file/below", false, false},  // ENOTDIR: neither, and logged.
  };
  for (const auto& [relative, exists, doesNotExist] : rows) {
    SCOPED_TRACE(relative);
    EXPECT_EQ(manager.itemExistsAtURL(url(relative)), exists);
    EXPECT_EQ(manager.itemDoesNotExistAtURL(url(relative)), doesNotExist);
  }
  EXPECT_TRUE(fakes.logging->containsMessage("Failed to determine if " + path("file/below") +
                                             " exists: Not a directory"));
}

TEST_F(FileManagerTest, TraversalVisitsEverythingOnceAndStopsWhenTheVisitorRefuses) {
  makeFile("tree/a");
  makeFile("tree/sub/b");
  makeFile("elsewhere/c");
  ASSERT_EQ(::symlink(path("elsewhere").c_str(), path("tree/link").c_str()), 0);
  std::vector<std::string> seen;
  KSTErrorRef error;
  EXPECT_TRUE(
      manager._traverseDirectory(url("tree", true), &error, [&](FTSENT* entry, KSTErrorRef*) {
        if (entry->fts_info != FTS_DP) seen.emplace_back(entry->fts_path);
        return true;
      }));
  EXPECT_EQ(seen.size(), 5u);  // tree, a, link, sub, sub/b: nothing behind the link

  int visits = 0;
  const KSTErrorRef refusal = KST_POSIX_ERROR(ECANCELED, "enough");
  EXPECT_FALSE(manager._traverseDirectory(url("tree", true), &error,
                                          [&](FTSENT*, KSTErrorRef* visitorError) {
                                            *visitorError = refusal;
                                            return ++visits < 2;
                                          }));
  EXPECT_EQ(visits, 2);
  EXPECT_EQ(error, refusal);
  EXPECT_FALSE(manager._traverseDirectory(url("absent", true), &error,
                                          [](FTSENT*, KSTErrorRef*) { return true; }));
  EXPECT_TRUE(isPOSIXError(error, ENOENT,
                           "Error for path " + path("absent") + ": No such file or directory"));
}

TEST_F(FileManagerTest, StandardizingOwnershipLeavesMetadataFilesAlone) {
  makeFile("c/data", "", 0600);
  makeFile("c/run.sh", "", 0700);
  makeFile("c/sub/.com.zorvane.kestrel.metadata.plist", "", 0600);
  ASSERT_EQ(::chmod(path("c/sub").c_str(), 0700), 0);
  ASSERT_EQ(::symlink("data", path("c/link").c_str()), 0);
  KSTErrorRef error;
  ASSERT_TRUE(manager.standardizeOwnershipAtURL(url("c", true), 501, 502, &error))
      << messageOf(error);
  // Item, owner and mode (0: not checked).
  const std::tuple<const char*, uid_t, mode_t> rows[] = {
      {"c", 501, 0755},        {"c/data", 501, 0644},
      {"c/run.sh", 501, 0755}, {"c/sub", 501, 0755},
      {"c/link", 501, 0},      {"c/sub/.com.zorvane.kestrel.metadata.plist", 0, 0600},
  };
  for (const auto& [relative, uid, mode] : rows) {
    SCOPED_TRACE(relative);
    const struct stat st = statOf(path(relative));
    EXPECT_EQ(st.st_uid, uid);
    EXPECT_EQ(st.st_gid, uid == 0 ? 0u : 502u);
    if (mode != 0) {
      EXPECT_EQ(st.st_mode & 07777, mode);
    }
  }
  EXPECT_FALSE(manager.standardizeOwnershipAtURL(url("absent", true), 501, 501, &error));
  EXPECT_EQ(messageOf(error), "Could not stat " + path("absent") + ": No such file or directory");
}

}  // namespace
}  // namespace kestrel
