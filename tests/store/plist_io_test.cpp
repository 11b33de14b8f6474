#include "store/plist_io.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/data_protection.h"
#include "platform/unique_fd.h"
#include "store/file_manager.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

class PlistIOTest : public ::testing::Test {
 protected:
  PlistIOTest() { fs::create_directory(directory()); }
  std::string directory() const { return fakes.scratch.path() + "/files"; }
  KSTFileURL url(const std::string& name) const { return KSTFileURL(directory() + "/" + name); }
  void writeRaw(const std::string& name, std::string_view contents) const {
    std::ofstream(url(name).path(), std::ios::binary) << contents;
  }
  std::vector<std::string> namesInDirectory() const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(directory())) {
      names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  testing::FakeServices fakes;
  const PlistDictionary metadata{{"Identifier", "com.example.app"},
                                 {"ContainerClass", 2},
                                 {"Info", PlistDictionary{{"Key", PlistData{1, 2}}}}};
};

TEST_F(PlistIOTest, WrittenDictionaryReadsBackFromABinaryFileInClassNone) {
  fakes.keyBag->setLockState(1);  // The daemon's files are written while locked too.
  KSTErrorRef error;
  ASSERT_TRUE(KST_writeToURL(metadata, url("meta.plist"), kKSTDaemonFileWritingOptions, &error))
      << FormatArg(error).description();

  EXPECT_EQ(fakes.scratch.readFile("/files/meta.plist").substr(0, 8), "bplist00");
  EXPECT_EQ(namesInDirectory(), std::vector<std::string>{"meta.plist"});  // No temporary file.
  struct stat st {};
  ASSERT_EQ(::lstat(url("meta.plist").path().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  const platform::UniqueFd fd(::open(url("meta.plist").path().c_str(), O_RDONLY));
  std::optional<std::int32_t> protectionClass;
  ASSERT_EQ(platform::getProtectionClass(fd.get(), &protectionClass), 0);
  EXPECT_EQ(protectionClass, static_cast<std::int32_t>(kKSTProtectionClassNone));

  const auto back =
      KST_dictionaryWithContentsOfURL(url("meta.plist"), kKSTPropertyListImmutable, &error);
  ASSERT_TRUE(back) << FormatArg(error).description();
  EXPECT_EQ(*back, metadata);
}

TEST_F(PlistIOTest, AtomicWriteReplacesALinkInsteadOfWritingThroughIt) {
  writeRaw("outside", "keep me");
  ASSERT_EQ(::symlink(url("outside").path().c_str(), url("meta.plist").path().c_str()), 0);
  ASSERT_TRUE(KST_writeToURL(metadata, url("meta.plist"), kKSTDaemonFileWritingOptions, nullptr));
  EXPECT_EQ(fakes.scratch.readFile("/files/outside"), "keep me");
  EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(url("meta.plist").path())));
}

TEST_F(PlistIOTest, ReadFailuresCarryTheirCause) {
  writeRaw("array.plist", "<plist><array><string>x</string></array></plist>");
  writeRaw("garbage.plist", "definitely not a property list");
  writeRaw("xml.plist", "<plist><dict><key>A</key><integer>1</integer></dict></plist>");
  ASSERT_EQ(::symlink(url("xml.plist").path().c_str(), url("link.plist").path().c_str()), 0);
  const struct {
    const char* name;
    std::string domain;
    std::int64_t code;
  } rows[] = {
      {"missing.plist", kPOSIXErrorDomain, ENOENT},
      {"array.plist", kPropertyListErrorDomain, kPropertyListFormattingError},
      {"garbage.plist", kPropertyListErrorDomain, kPropertyListReadCorruptError},
      {"link.plist", kPOSIXErrorDomain, ELOOP},  // Never read through a link.
      {"", kPOSIXErrorDomain, EISDIR},           // The directory itself.
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    KSTErrorRef error;
    EXPECT_FALSE(KST_dictionaryWithContentsOfURL(url(row.name), kKSTPropertyListImmutable, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), row.domain);
    EXPECT_EQ(error->code(), row.code);
  }
  const auto xml =
      KST_dictionaryWithContentsOfURL(url("xml.plist"), kKSTPropertyListImmutable, nullptr);
  ASSERT_TRUE(xml);
  EXPECT_EQ(*xml, (PlistDictionary{{"A", 1}}));
}

TEST_F(PlistIOTest, FailedWritesLeaveTheOldFileAndNoTemporaryFile) {
  ASSERT_TRUE(KST_writeToURL(metadata, url("meta.plist"), kKSTDaemonFileWritingOptions, nullptr));
  const std::string before = fakes.scratch.readFile("/files/meta.plist");

  KSTErrorRef error;
  EXPECT_FALSE(KST_writeToURL(PlistDictionary{{"bad", "\xFF"}}, url("meta.plist"),
                              kKSTDaemonFileWritingOptions, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kPropertyListErrorDomain);
  EXPECT_EQ(error->code(), kPropertyListWriteInvalidError);

  EXPECT_FALSE(KST_writeToURL(metadata, url("no-such-dir/meta.plist"), kKSTDaemonFileWritingOptions,
                              &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->isPOSIXError(ENOENT));

  EXPECT_EQ(fakes.scratch.readFile("/files/meta.plist"), before);
  EXPECT_EQ(namesInDirectory(), std::vector<std::string>{"meta.plist"});
}

}  // namespace
}  // namespace kestrel
