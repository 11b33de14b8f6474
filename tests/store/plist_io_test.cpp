#include "store/plist_io.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "store/file_manager.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::isError;

class PlistIOTest : public ::testing::Test {
 protected:
  PlistIOTest() { fs::create_directory(directory()); }
  std::string directory() const { return fakes.scratch.path() + "/files"; }
  KSTFileURL url(const std::string& name) const { return KSTFileURL(directory() + "/" + name); }
  void writeRaw(const std::string& name, std::string_view contents) const {
    std::ofstream(url(name).path(), std::ios::binary) << contents;
  }

  testing::FakeServices fakes;
  const PlistDictionary metadata{{"Identifier", "com.example.app"},
                                 {"ContainerClass", 2},
                                 {"Info", PlistDictionary{{"Key", PlistData{1, 2}}}}};
};

TEST_F(PlistIOTest, WriteIsAtomicBinaryInClassNoneReplacesALinkAndFailsWithoutATrace) {
  fakes.keyBag->setLockState(1);  // The daemon's files are written while locked too.
  writeRaw("outside", "keep me");
  ASSERT_EQ(::symlink(url("outside").path().c_str(), url("meta.plist").path().c_str()), 0);
  KSTErrorRef error;
  ASSERT_TRUE(KST_writeToURL(metadata, url("meta.plist"), kKSTDaemonFileWritingOptions, &error))
      << testing::messageOf(error);
  // The link is replaced, not written through.
  EXPECT_EQ(fakes.scratch.readFile("/files/outside"), "keep me");
  EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(url("meta.plist").path())));
  const std::string written = fakes.scratch.readFile("/files/meta.plist");
  EXPECT_EQ(written.substr(0, 8), "bplist00");
  EXPECT_EQ(testing::modeOf(url("meta.plist").path()), 0644u);
  EXPECT_EQ(testing::protectionClassOf(url("meta.plist").path()),
            static_cast<std::int32_t>(kKSTProtectionClassNone));
  const auto back =
      KST_dictionaryWithContentsOfURL(url("meta.plist"), kKSTPropertyListImmutable, &error);
  ASSERT_TRUE(back) << testing::messageOf(error);
  EXPECT_EQ(*back, metadata);

  // Failed writes leave the old file and no temporary file.
  EXPECT_FALSE(KST_writeToURL(PlistDictionary{{"bad", "\xFF"}}, url("meta.plist"),
                              kKSTDaemonFileWritingOptions, &error));
  EXPECT_TRUE(
      isError(error, kPropertyListWriteInvalidError, std::nullopt, kPropertyListErrorDomain));
  EXPECT_FALSE(KST_writeToURL(metadata, url("no-such-dir/meta.plist"), kKSTDaemonFileWritingOptions,
                              &error));
  EXPECT_TRUE(testing::isPOSIXError(error, ENOENT));
  EXPECT_EQ(fakes.scratch.readFile("/files/meta.plist"), written);
  EXPECT_EQ(testing::namesIn(directory()), (std::vector<std::string>{"meta.plist", "outside"}));
}

TEST_F(PlistIOTest, ReadFailuresCarryTheirCause) {
  writeRaw("array.plist", "<plist><array><string>x</string></array></plist>");
  writeRaw("garbage.plist", "definitely not a property list");
  writeRaw("xml.plist", "<plist><dict><key>A</key><integer>1</integer></dict></plist>");
  ASSERT_EQ(::symlink(url("xml.plist").path().c_str(), url("link.plist").path().c_str()), 0);
  const std::tuple<const char*, const char*, std::int64_t> rows[] = {
      {"missing.plist", kPOSIXErrorDomain, ENOENT},
      {"array.plist", kPropertyListErrorDomain, kPropertyListFormattingError},
      {"garbage.plist", kPropertyListErrorDomain, kPropertyListReadCorruptError},
      {"link.plist", kPOSIXErrorDomain, ELOOP},  // Never read through a link.
      {"", kPOSIXErrorDomain, EISDIR},           // The directory itself.
  };
  for (const auto& [name, domain, code] : rows) {
    KSTErrorRef error;
    EXPECT_FALSE(KST_dictionaryWithContentsOfURL(url(name), kKSTPropertyListImmutable, &error));
    EXPECT_TRUE(isError(error, code, std::nullopt, domain)) << name;
  }
  const auto xml =
      KST_dictionaryWithContentsOfURL(url("xml.plist"), kKSTPropertyListImmutable, nullptr);
  ASSERT_TRUE(xml);
  EXPECT_EQ(*xml, (PlistDictionary{{"A", 1}}));
}

}  // namespace
}  // namespace kestrel
