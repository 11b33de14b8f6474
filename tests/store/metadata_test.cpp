#include "store/metadata.h"

#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>

#include "store/plist_io.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::messageOf;

constexpr const char* kUuidText = "6F1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D";

class MetadataTest : public ::testing::Test {
 protected:
  // A container directory of a class beneath mobile's Containers directory.
  KSTFileURL containerAt(std::string_view classPath, const std::string& name) const {
    const std::string path = fakes.scratch.resolve("/private/var/mobile/Containers/") +
                             std::string(classPath) + "/" + name;
    fs::create_directories(path);
    return KSTFileURL(path, true);
  }
  static std::string metadataPath(const KSTFileURL& container) {
    return KSTMetadata::metadataFileURL(container).path();
  }
  static void write(const KSTFileURL& container, const PlistDictionary& dictionary) {
    ASSERT_TRUE(KST_writeToURL(dictionary, KSTMetadata::metadataFileURL(container),
                               kKSTDaemonFileWritingOptions, nullptr));
  }
  static PlistDictionary valid() {
    return PlistDictionary{{kKSTMetadataIdentifierKey, "com.example.app"},
                           {kKSTMetadataUUIDKey, kUuidText},
                           {kKSTMetadataContentClassKey, 2u},
                           {kKSTMetadataPersonaKey, 501u}};
  }
  static PlistDictionary with(const char* key, PlistValue value, PlistDictionary d = valid()) {
    d[key] = std::move(value);
    return d;
  }
  static PlistDictionary without(const char* key, PlistDictionary d = valid()) {
    d.erase(key);
    return d;
  }
  // Reads the container as user 501 of its class and expects the error.
  void expectRefused(const KSTFileURL& container, std::int64_t code, const std::string& message,
                     std::uint32_t user = 501) {
    fakes.logging->clear();
    KSTErrorRef error;
    EXPECT_EQ(KSTMetadata::readAndValidateMetadataAtUrl(container, user, true, &error), nullptr);
    EXPECT_TRUE(testing::isError(error, code, message, kKSTErrorDomain));
    EXPECT_TRUE(fakes.logged(message));  // by the error builder
  }

  testing::FakeServices fakes;
  int containers = 0;
};

TEST_F(MetadataTest, UnreadableFilesFailWith12) {
  const KSTFileURL good = containerAt("Data/Application", "GOOD");
  write(good, valid());
  const std::pair<const char*, std::function<void(const std::string&)>> rows[] = {
      {"no file", [](const std::string&) {}},
      {"top-level array",
       [](const std::string& p) {
         std::ofstream(p) << "<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>";
       }},
      {"link to a valid file",
       [&](const std::string& p) { fs::create_symlink(metadataPath(good), p); }},
      {"fifo", [](const std::string& p) { ASSERT_EQ(::mkfifo(p.c_str(), 0644), 0); }},
      {"larger than any metadata",
       [](const std::string& p) {
         std::ofstream(p) << "x";
         fs::resize_file(p, std::uintmax_t{64} * 1024 * 1024);
       }},
  };
  for (const auto& [label, makeFile] : rows) {
    SCOPED_TRACE(label);
    const KSTFileURL container = containerAt("Data/Application", label);
    makeFile(metadataPath(container));
    expectRefused(container, 12, "Failed to read metadata at URL " + container.path());
  }
}

TEST_F(MetadataTest, InvalidContentsFailWith29AndNameWhatIsWrong) {
  const std::tuple<PlistDictionary, std::string, std::uint32_t, const char*> rows[] = {
      {without(kKSTMetadataIdentifierKey), "Invalid metadata Identifier: (null)", 501, ""},
      {without(kKSTMetadataUUIDKey), "Invalid metadata UUID String: (null)", 501, ""},
      {with(kKSTMetadataUUIDKey, "not-a-uuid"), "Invalid metadata UUID: not-a-uuid", 501, ""},
      {with(kKSTMetadataContentClassKey, "2"), "Invalid metadata Class: 2", 501, ""},
      {with(kKSTMetadataContentClassKey, 14), "Invalid metadata Content Class: 14", 501, ""},
      {valid(), "Incorrect UserId: 501, expecting: 502 for com.example.app", 502, ""},
      {with(kKSTMetadataPersonaKey, std::uint64_t{501} + (std::uint64_t{1} << 32)),
       "Incorrect UserId: 4294967797, expecting: 501 for com.example.app", 501, ""},
      {with(kKSTMetadataInfoKey, "x"), "Invalid metadata Info: x", 501, ""},
      // A container of one class with the metadata of another.
      {valid(), "Invalid metadata-URLs should match", 501, "Data/VantlerPlugin"},
  };
  for (const auto& [contents, message, user, otherClassPath] : rows) {
    SCOPED_TRACE(message);
    const std::string name = "C" + std::to_string(++containers);
    const bool elsewhere = *otherClassPath != '\0';
    const KSTFileURL container = containerAt(elsewhere ? otherClassPath : "Data/Application", name);
    write(container, contents);
    const std::string at =
        elsewhere ? ": " + container.path() + " : " +
                        fakes.scratch.resolve("/private/var/mobile/Containers/Data/Application")
                  : " at " + container.path();
    expectRefused(container, 29, message + at, user);
  }
}

TEST_F(MetadataTest, AcceptedFilesGiveARecordOfTheExpectedUser) {
  const std::tuple<PlistDictionary, std::uint32_t, bool, const char*, KSTContainerClass> rows[] = {
      // No persona: another mobile user's, and the installer's bundle.
      {without(kKSTMetadataPersonaKey), 502, true, "Data/Application", 2},
      {without(kKSTMetadataPersonaKey, with(kKSTMetadataContentClassKey, 1)), 33, true,
       "Bundle/Application", 1},
      // Another class directory, not checked.
      {valid(), 501, false, "Data/VantlerPlugin", 2},
      {with("Other", PlistArray{1, 2},
            with(kKSTMetadataUUIDKey, "6f1b2c3d-4e5f-4a6b-8c7d-9e0f1a2b3c4d")),
       501, true, "Data/Application", 2},
  };
  for (const auto& [contents, user, checkClassPath, classPath, containerClass] : rows) {
    SCOPED_TRACE(classPath);
    const KSTFileURL container = containerAt(classPath, "C" + std::to_string(++containers));
    write(container, contents);
    KSTErrorRef error;
    auto record =
        KSTMetadata::readAndValidateMetadataAtUrl(container, user, checkClassPath, &error);
    ASSERT_NE(record, nullptr) << messageOf(error);
    EXPECT_EQ(record->uid(), user);
    EXPECT_EQ(record->identifier(), "com.example.app");
    EXPECT_EQ(record->containerClass(), containerClass);
    EXPECT_EQ(record->uuid().string(), kUuidText);
    EXPECT_EQ(record->url(), container);
  }
}

TEST_F(MetadataTest, WrittenRecordReadsBackAndIsAStandardBinaryPropertyList) {
  fakes.keyBag->setLockState(1);  // Written while locked too.
  const KSTFileURL container = containerAt("Data/Application", "ROUNDTRIP");
  const platform::Uuid uuid = platform::Uuid::random();
  auto record =
      KSTMetadata::initWithUserId(501, uuid, 2, "com.example.app", std::nullopt, container);
  // Without info, the file has no such key.
  ASSERT_TRUE(record->writeMetadataToDiskWithError(nullptr));
  auto file = KST_dictionaryWithContentsOfURL(KSTMetadata::metadataFileURL(container), 0, nullptr);
  ASSERT_TRUE(file);
  EXPECT_EQ(file->count(kKSTMetadataInfoKey), 0u);
  EXPECT_EQ(file->size(), 4u);
  // Rewritten in place with info.
  const PlistDictionary info{{"com.zorvane.Tessel.ContentProtectionClass", 3},
                             {"Nested", PlistDictionary{{"Data", PlistData{1, 2, 3}}}}};
  record->setInfo(info);
  KSTErrorRef error;
  ASSERT_TRUE(record->writeMetadataToDiskWithError(&error)) << messageOf(error);
  auto back = KSTMetadata::readAndValidateMetadataAtUrl(container, 501, true, &error);
  ASSERT_NE(back, nullptr) << messageOf(error);
  EXPECT_EQ(back->uuid(), uuid);
  ASSERT_TRUE(back->info());
  EXPECT_EQ(PlistValue(*back->info()), PlistValue(info));
  EXPECT_EQ(testing::protectionClassOf(metadataPath(container)), 4);

  // What any property-list reader sees.
  std::ifstream in(metadataPath(container), std::ios::binary);
  const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  ASSERT_EQ(bytes.substr(0, 8), "bplist00");
  plist_t root = nullptr;
  plist_from_bin(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
  ASSERT_NE(root, nullptr);
  std::unique_ptr<void, void (*)(plist_t)> owner(root, plist_free);
  ASSERT_EQ(plist_get_node_type(root), PLIST_DICT);
  for (const auto& [key, type] : {std::pair{kKSTMetadataContentClassKey, PLIST_UINT},
                                  std::pair{kKSTMetadataPersonaKey, PLIST_UINT},
                                  std::pair{kKSTMetadataIdentifierKey, PLIST_STRING}}) {
    plist_t node = plist_dict_get_item(root, key);
    ASSERT_NE(node, nullptr) << key;
    EXPECT_EQ(plist_get_node_type(node), type) << key;
  }
  char* text = nullptr;
  plist_get_string_val(plist_dict_get_item(root, kKSTMetadataUUIDKey), &text);
  ASSERT_NE(text, nullptr);
  EXPECT_EQ(std::string(text), uuid.string());
  EXPECT_EQ(std::string(text).find_first_of("abcdef"), std::string::npos);
  std::free(text);

  // Failed writes give code 34 with the writer's error, and leave no file.
  for (const auto& [url, identifier] :
       {std::pair{KSTFileURL(fakes.scratch.resolve("/nowhere/C"), true), std::string("com.a")},
        std::pair{containerAt("Data/Application", "BAD"), std::string("com.\xff\xfe")}}) {
    SCOPED_TRACE(url.path());
    auto bad = KSTMetadata::initWithUserId(501, uuid, 2, identifier, std::nullopt, url);
    EXPECT_FALSE(bad->writeMetadataToDiskWithError(&error));
    EXPECT_TRUE(
        testing::isError(error, 34, "Failed to write metadata dictionary to URL " + url.path()));
    EXPECT_NE(error->underlyingError(), nullptr);
    EXPECT_FALSE(fs::exists(metadataPath(url)));
  }
}

}  // namespace
}  // namespace kestrel
