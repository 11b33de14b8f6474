#include "store/file_manager.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>

#include "daemon/log.h"
#include "platform/data_protection.h"
#include "platform/file_system.h"
#include "platform/unique_fd.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

struct AclDeleter {
  void operator()(void* p) const { acl_free(p); }
};

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
  void makeFile(const std::string& relative, std::string_view contents = "", mode_t mode = 0644) {
    fs::create_directories(fs::path(path(relative)).parent_path());
    std::ofstream(path(relative), std::ios::binary) << contents;
    ::chmod(path(relative).c_str(), mode);
  }
  void makeImmutable(const std::string& relative) {
    ASSERT_EQ(platform::lchflags(path(relative).c_str(), platform::kFileFlagUserImmutable), 0);
    immutable_.push_back(path(relative));
  }
  struct stat statOf(const std::string& relative) const {
    struct stat st {};
    EXPECT_EQ(::lstat(path(relative).c_str(), &st), 0) << relative;
    return st;
  }
  static std::string attribute(const std::string& file, const char* name) {
    char buffer[256];
    const ssize_t n = ::lgetxattr(file.c_str(), name, buffer, sizeof buffer);
    return n < 0 ? "<none>" : std::string(buffer, static_cast<std::size_t>(n));
  }
  static std::string aclText(const std::string& file, acl_type_t type) {
    const std::unique_ptr<void, AclDeleter> acl(acl_get_file(file.c_str(), type));
    if (!acl) return "<none>";
    const std::unique_ptr<void, AclDeleter> text(
        acl_to_text(static_cast<acl_t>(acl.get()), nullptr));
    return static_cast<const char*>(text.get());
  }
  static void setAcl(const std::string& file, acl_type_t type, const char* text) {
    const std::unique_ptr<void, AclDeleter> acl(acl_from_text(text));
    ASSERT_TRUE(acl) << text;
    ASSERT_EQ(acl_set_file(file.c_str(), type, static_cast<acl_t>(acl.get())), 0) << text;
  }
  std::optional<std::int32_t> protectionClassOf(const std::string& relative) const {
    const platform::UniqueFd fd(::open(path(relative).c_str(), O_RDONLY));
    std::optional<std::int32_t> protectionClass;
    EXPECT_EQ(platform::getProtectionClass(fd.get(), &protectionClass), 0);
    return protectionClass;
  }
  std::optional<platform::FakeLogLine> logLine(std::string_view message) const {
    for (const auto& line : fakes.logging->lines()) {
      if (line.message == message) return line;
    }
    return std::nullopt;
  }

  testing::FakeServices fakes;
  const KSTFileManager& manager = KSTFileManager::defaultManager();

 private:
  std::vector<std::string> immutable_;
};

std::string describe(const KSTErrorRef& error) {
  return error ? *error->localizedDescription() : "(none)";
}

// --- Removal ----------------------------------------------------------------------------------

TEST_F(FileManagerTest, MissingItemsAndNoURL) {
  KSTErrorRef error;
  EXPECT_TRUE(manager.removeItemAtURL(url("never-there"), &error));
  EXPECT_TRUE(manager.moveItemIfExistsAtURL(url("never-there"), url("there"), &error));
  EXPECT_FALSE(manager.moveItemAtURL(url("never-there"), url("there"), &error));
  EXPECT_EQ(describe(error), "rename of " + path("never-there") + " to " + path("there") +
                                 " failed: No such file or directory");
  EXPECT_FALSE(manager.removeItemAtURL(KSTFileURL(), &error));
  EXPECT_TRUE(error->isPOSIXError(EFAULT));
  EXPECT_EQ(describe(error), "nil url passed to -removeItemAtURL:error:");
}

TEST_F(FileManagerTest, RemovalTakesTheTreeButNothingItsLinksPointTo) {
  makeFile("tree/a", "a");
  makeFile("tree/sub/b", "b");
  makeFile("outside/keep", "keep");
  ASSERT_EQ(::symlink(path("outside").c_str(), path("tree/sub/dirlink").c_str()), 0);
  ASSERT_EQ(::symlink(path("outside/keep").c_str(), path("filelink").c_str()), 0);
  KSTErrorRef error;
  EXPECT_TRUE(manager.removeItemAtURL(url("tree", true), &error)) << describe(error);
  EXPECT_TRUE(manager.removeItemAtURL(url("filelink"), &error)) << describe(error);
  EXPECT_FALSE(fakes.scratch.exists("/tree"));
  EXPECT_FALSE(fakes.scratch.exists("/filelink"));
  EXPECT_EQ(fakes.scratch.readFile("/outside/keep"), "keep");
}

TEST_F(FileManagerTest, RemovalClearsTheImmutableFlag) {
  makeFile("tree/sub/locked", "x");
  makeImmutable("tree/sub/locked");
  KSTErrorRef error;
  EXPECT_TRUE(manager.removeItemAtURL(url("tree", true), &error)) << describe(error);
  EXPECT_FALSE(fakes.scratch.exists("/tree"));
  EXPECT_TRUE(fakes.logging->contains("_treeremove_error_callback",
                                      "Unset UF_IMMUTABLE on " + path("tree/sub/locked")));
  EXPECT_TRUE(logLine("treeremove hit error for " + path("tree/sub/locked") +
                      " : Operation not permitted"));
}

TEST_F(FileManagerTest, RemovalReportsTheFirstErrorAndGoesOn) {
  // An immutable directory: its file cannot go (EPERM, first), then the
  // directory is left non-empty (ENOTEMPTY, later); the rest is removed.
  makeFile("tree/frozen/file");
  makeFile("tree/other/file");
  makeImmutable("tree/frozen");
  KSTErrorRef error;
  EXPECT_FALSE(manager.removeItemAtURL(url("tree", true), &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isPOSIXError(EPERM)) << error->description();
  EXPECT_EQ(describe(error), "treeremove of " + path("tree") + " failed: Operation not permitted");
  EXPECT_FALSE(fakes.scratch.exists("/tree/other"));
  EXPECT_TRUE(fakes.scratch.exists("/tree/frozen/file"));
}

// --- Directories ------------------------------------------------------------------------------

TEST_F(FileManagerTest, NewDirectoryGetsModeOwnerAndClassAnExistingOneKeepsItsMode) {
  KSTErrorRef error;
  ASSERT_TRUE(manager.createDirectoryAtURL(url("a/b/c", true), true, 0750, 501,
                                           KSTProtectionClass{0}, &error))
      << describe(error);
  EXPECT_EQ(statOf("a").st_mode & 07777, 0750u);
  const struct stat made = statOf("a/b/c");
  EXPECT_EQ(made.st_mode & 07777, 0750u);
  EXPECT_EQ(made.st_gid, 501u);
  EXPECT_EQ(protectionClassOf("a/b/c"), 0);

  // Owner 0 and class -1 leave both alone.
  ASSERT_TRUE(manager.createDirectoryAtURL(url("plain", true), false, 0755, &error));
  EXPECT_EQ(statOf("plain").st_uid, 0u);
  EXPECT_EQ(protectionClassOf("plain"), std::nullopt);

  ASSERT_TRUE(manager.createDirectoryAtURL(url("a", true), false, 0755, 502, KSTProtectionClass{3},
                                           &error));
  EXPECT_EQ(statOf("a").st_mode & 07777, 0750u);
  EXPECT_EQ(statOf("a").st_uid, 502u);
  EXPECT_EQ(protectionClassOf("a"), 3);
}

TEST_F(FileManagerTest, DirectoryFailures) {
  makeFile("file");
  ASSERT_EQ(::mkdir(path("exists").c_str(), 0755), 0);
  const struct {
    const char* name;
    std::string relative;
    bool parents;
    bool locked;
    int code;
    std::string message;
  } rows[] = {
      {"missing parent", "no/such", false, false, ENOENT,
       "mkdir of " + path("no/such") + " failed: No such file or directory"},
      {"parent is a file", "file/sub", true, false, ENOTDIR,
       "makepath of " + path("file/sub") + " failed: Not a directory"},
      {"class while locked", "exists", true, true, EPERM,
       "Failed to setclass(1) on directory " + path("exists") + ": Operation not permitted"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    fakes.keyBag->setLockState(row.locked ? 1 : 0);
    KSTErrorRef error;
    EXPECT_FALSE(manager.createDirectoryAtURL(url(row.relative, true), row.parents, 0755, 501,
                                              KSTProtectionClass{1}, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(row.code)) << error->description();
    EXPECT_EQ(describe(error), row.message);
  }
}

// --- Copy and move ------------------------------------------------------------------------------

TEST_F(FileManagerTest, CopyKeepsDataModesOwnersAttributesAclsAndLinks) {
  makeFile("src/file", "hello", 0640);
  makeFile("src/tool", "#!/bin/sh\n", 04755);
  makeFile("src/sub/deep", "deep", 0600);
  ASSERT_EQ(::chown(path("src/file").c_str(), 501, 502), 0);
  ASSERT_EQ(::chown(path("src/tool").c_str(), 501, 501), 0);
  ASSERT_EQ(::chmod(path("src/tool").c_str(), 04755), 0);  // chown cleared set-uid
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
  ASSERT_TRUE(manager.copyItemAtURL(url("src", true), url("dst", true), &error)) << describe(error);

  for (const char* relative : {"", "/file", "/tool", "/sub", "/sub/deep", "/link"}) {
    SCOPED_TRACE(relative);
    const struct stat from = statOf(std::string("src") + relative);
    const struct stat to = statOf(std::string("dst") + relative);
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
}

TEST_F(FileManagerTest, CopyFailuresAndMissingSources) {
  makeFile("src/file", "x");
  makeFile("taken");
  const struct {
    const char* name;
    std::string from;
    std::string to;
    bool failIfMissing;
    int code;  // 0: success
  } rows[] = {
      {"destination exists", "src", "taken", true, EEXIST},
      {"missing source allowed", "absent", "copy", false, 0},
      {"into itself", "src", "src/inner", true, EINVAL},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    KSTErrorRef error;
    const bool copied =
        manager._copyItemAtURL(url(row.from), url(row.to), row.failIfMissing, &error);
    EXPECT_EQ(copied, row.code == 0);
    if (row.code == 0) continue;
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(row.code)) << error->description();
    EXPECT_EQ(describe(error).rfind(
                  "copytree of " + path(row.from) + " to " + path(row.to) + " failed: ", 0),
              0u);
  }
  EXPECT_FALSE(fakes.scratch.exists("/copy"));
  EXPECT_EQ(fakes.scratch.readFile("/taken"), "");
}

TEST_F(FileManagerTest, MoveAcrossFileSystemsCopiesAndRemovesTheSource) {
  struct stat shm {};
  if (::stat("/dev/shm", &shm) != 0 || shm.st_dev == statOf("").st_dev) {
    GTEST_SKIP() << "no second file system at /dev/shm";
  }
  std::string other = "/dev/shm/kestrel-move-XXXXXX";
  ASSERT_NE(::mkdtemp(other.data()), nullptr);
  const std::unique_ptr<std::string, void (*)(std::string*)> cleanup(
      &other, [](std::string* p) { fs::remove_all(*p); });

  makeFile("src/sub/file", "data", 0600);
  ASSERT_EQ(::chown(path("src/sub/file").c_str(), 501, 501), 0);
  ASSERT_EQ(::setxattr(path("src/sub/file").c_str(), platform::kProtectionClassAttribute,
                       "\x01\0\0\0", 4, 0),
            0);
  KSTErrorRef error;
  ASSERT_TRUE(manager.moveItemAtURL(url("src", true), KSTFileURL(other + "/moved", true), &error))
      << describe(error);
  EXPECT_FALSE(fakes.scratch.exists("/src"));
  struct stat moved {};
  ASSERT_EQ(::lstat((other + "/moved/sub/file").c_str(), &moved), 0);
  EXPECT_EQ(moved.st_uid, 501u);
  EXPECT_EQ(moved.st_mode & 07777, 0600u);
  EXPECT_EQ(attribute(other + "/moved/sub/file", platform::kProtectionClassAttribute),
            std::string("\x01\0\0\0", 4));
}

// --- Temporary directories, listing, existence ---------------------------------------------------

TEST_F(FileManagerTest, TemporaryDirectoryIsPrivateAndOwned) {
  KSTErrorRef error = KST_POSIX_ERROR(EIO, "left over");
  const auto owned = manager.createTemporaryDirectoryInDirectoryURL(url("", true), 501, &error);
  ASSERT_TRUE(owned);
  EXPECT_FALSE(error);  // Cleared on entry.
  const std::string name = owned->lastPathComponent();
  EXPECT_EQ(name.rfind("temp.", 0), 0u);
  const struct stat st = statOf(name);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  EXPECT_EQ(st.st_uid, 501u);

  EXPECT_FALSE(manager.createTemporaryDirectoryInDirectoryURL(url("absent", true), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(describe(error), "Failed to create temp dir at path " + path("absent/temp.XXXXXX") +
                                 " : No such file or directory");
}

TEST_F(FileManagerTest, ListingSkipsHiddenItemsAndMarksDirectories) {
  makeFile("dir/file");
  makeFile("dir/.hidden");
  makeFile("dir/.com.zorvane.kestrel.metadata.plist");
  makeFile("dir/sub/inner");
  makeFile("hidden-only/.only");
  ASSERT_EQ(::symlink(path("dir/sub").c_str(), path("dir/link").c_str()), 0);
  KSTErrorRef error;
  auto urls = manager.urlsForItemsInDirectoryAtURL(url("dir", true), &error);
  ASSERT_TRUE(urls) << describe(error);
  std::sort(urls->begin(), urls->end());
  ASSERT_EQ(urls->size(), 3u);
  EXPECT_EQ((*urls)[0], url("dir/file"));
  EXPECT_FALSE((*urls)[0].isDirectory());
  EXPECT_EQ((*urls)[1], url("dir/link"));
  EXPECT_FALSE((*urls)[1].isDirectory());  // A link to a directory is not one.
  EXPECT_EQ((*urls)[2], url("dir/sub"));
  EXPECT_TRUE((*urls)[2].isDirectory());

  urls = manager.urlsForItemsInDirectoryAtURL(url("hidden-only", true), &error);
  ASSERT_TRUE(urls);
  EXPECT_TRUE(urls->empty());
}

TEST_F(FileManagerTest, ListingFailures) {
  makeFile("file");
  KSTErrorRef error;
  EXPECT_FALSE(manager.urlsForItemsInDirectoryAtURL(url("absent", true), &error));
  EXPECT_EQ(describe(error),
            "_IterateDirectory for " + path("absent") + " returned No such file or directory");
  EXPECT_TRUE(fakes.logging->lines().empty());  // a missing directory is not logged

  EXPECT_FALSE(manager.urlsForItemsInDirectoryAtURL(url("file"), &error));
  EXPECT_TRUE(fakes.logging->contains("_IterateDirectory",
                                      "opendir of " + path("file") + " failed: Not a directory"));
}

TEST_F(FileManagerTest, ExistenceIsDecidedWithoutFollowingLinks) {
  makeFile("file");
  ASSERT_EQ(::symlink(path("absent").c_str(), path("dangling").c_str()), 0);
  const struct {
    const char* relative;
    bool exists;
    bool doesNotExist;
  } rows[] = {
      {"file", true, false},
      {"absent", false, true},
      {"dangling", true, false},
      {"file/below", false, false},  // ENOTDIR: neither, and logged.
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.relative);
    EXPECT_EQ(manager.itemExistsAtURL(url(row.relative)), row.exists);
    EXPECT_EQ(manager.itemDoesNotExistAtURL(url(row.relative)), row.doesNotExist);
  }
  EXPECT_TRUE(logLine("Failed to determine if " + path("file/below") + " exists: Not a directory"));
}

// --- Traversal, ownership, diagnostics ------------------------------------------------------

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
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isPOSIXError(ENOENT));
  EXPECT_EQ(describe(error), "Error for path " + path("absent") + ": No such file or directory");
}

TEST_F(FileManagerTest, StandardizingOwnershipLeavesMetadataFilesAlone) {
  makeFile("c/data", "", 0600);
  makeFile("c/run.sh", "", 0700);
  makeFile("c/sub/.com.zorvane.kestrel.metadata.plist", "", 0600);
  ASSERT_EQ(::chmod(path("c/sub").c_str(), 0700), 0);
  ASSERT_EQ(::symlink("data", path("c/link").c_str()), 0);
  KSTErrorRef error;
  ASSERT_TRUE(manager.standardizeOwnershipAtURL(url("c", true), 501, 502, &error))
      << describe(error);
  const struct {
    const char* relative;
    uid_t uid;
    mode_t mode;  // 0: not checked
  } rows[] = {
      {"c", 501, 0755},        {"c/data", 501, 0644},
      {"c/run.sh", 501, 0755}, {"c/sub", 501, 0755},
      {"c/link", 501, 0},      {"c/sub/.com.zorvane.kestrel.metadata.plist", 0, 0600},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.relative);
    const struct stat st = statOf(row.relative);
    EXPECT_EQ(st.st_uid, row.uid);
    EXPECT_EQ(st.st_gid, row.uid == 0 ? 0u : 502u);
    if (row.mode != 0) {
      EXPECT_EQ(st.st_mode & 07777, row.mode);
    }
  }

  EXPECT_FALSE(manager.standardizeOwnershipAtURL(url("absent", true), 501, 501, &error));
  EXPECT_EQ(describe(error), "Could not stat " + path("absent") + ": No such file or directory");
}

}  // namespace
}  // namespace kestrel
