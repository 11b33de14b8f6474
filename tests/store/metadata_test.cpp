#include "store/metadata.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <variant>

#include "platform/data_protection.h"
#include "platform/unique_fd.h"
#include "store/plist_io.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kUuidText = "6F1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D";

class MetadataTest : public ::testing::Test {
 protected:
  // A container directory of a class beneath mobile's Containers directory.
  KSTFileURL containerAt(std::string_view classPath, std::string_view name = "CONTAINER") const {
    const std::string path = fakes.scratch.resolve("/private/var/mobile/Containers/") +
                             std::string(classPath) + "/" + std::string(name);
    fs::create_directories(path);
    return KSTFileURL(path, true);
  }
  static std::string metadataPath(const KSTFileURL& container) {
    return KSTMetadata::metadataFileURL(container).path();
  }
  static void writeDictionary(const KSTFileURL& container, const PlistDictionary& dictionary) {
    KSTErrorRef error;
    ASSERT_TRUE(KST_writeToURL(dictionary, KSTMetadata::metadataFileURL(container),
                               kKSTDaemonFileWritingOptions, &error));
  }
  static void writeRaw(const KSTFileURL& container, std::string_view bytes) {
    std::ofstream(metadataPath(container), std::ios::binary | std::ios::trunc) << bytes;
  }
  static PlistDictionary valid() {
    return PlistDictionary{{kKSTMetadataIdentifierKey, "com.example.app"},
                           {kKSTMetadataUUIDKey, kUuidText},
                           {kKSTMetadataContentClassKey, 2u},
                           {kKSTMetadataPersonaKey, 501u}};
  }
  static PlistDictionary with(PlistDictionary d, const char* key, PlistValue value) {
    d[key] = std::move(value);
    return d;
  }
  static PlistDictionary without(PlistDictionary d, const char* key) {
    d.erase(key);
    return d;
  }
  static std::string messageOf(const KSTErrorRef& error) {
    return error ? error->localizedDescription().value_or("") : "";
  }

  testing::FakeServices fakes;
};

// What to put in the metadata file of a row: nothing, a dictionary, raw bytes,
// or whatever the function makes at the file's path.
struct NoFile {};
using MakeFile = std::function<void(const std::string& path)>;
using Contents = std::variant<NoFile, PlistDictionary, std::string, MakeFile>;

TEST_F(MetadataTest, HostileFilesGiveTheirCodeAndMessage) {
  const KSTFileURL good = containerAt("Data/Application", "GOOD");
  writeDictionary(good, valid());
  struct Row {
    const char* label;
    Contents contents;
    std::uint64_t code;
    std::string message;  // "@" stands for the container path.
    std::uint32_t user = 501;
    const char* classPath = "Data/Application";
  };
  const Row rows[] = {
      {"no file", NoFile{}, 12, "Failed to read metadata at URL @"},
      {"top-level array",
       std::string("<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>"), 12,
       "Failed to read metadata at URL @"},
      {"link to a valid file",
       MakeFile([&](const std::string& p) { fs::create_symlink(metadataPath(good), p); }), 12,
       "Failed to read metadata at URL @"},
      {"fifo", MakeFile([](const std::string& p) { ASSERT_EQ(::mkfifo(p.c_str(), 0644), 0); }), 12,
       "Failed to read metadata at URL @"},
      {"larger than any metadata", MakeFile([](const std::string& p) {
         std::ofstream(p) << "x";
         fs::resize_file(p, std::uintmax_t{64} * 1024 * 1024);
       }),
       12, "Failed to read metadata at URL @"},
      {"no identifier", without(valid(), kKSTMetadataIdentifierKey), 29,
       "Invalid metadata Identifier: (null) at @"},
      {"no UUID", without(valid(), kKSTMetadataUUIDKey), 29,
       "Invalid metadata UUID String: (null) at @"},
      {"unparsable UUID", with(valid(), kKSTMetadataUUIDKey, "not-a-uuid"), 29,
       "Invalid metadata UUID: not-a-uuid at @"},
      {"string class", with(valid(), kKSTMetadataContentClassKey, "2"), 29,
       "Invalid metadata Class: 2 at @"},
      {"class 14", with(valid(), kKSTMetadataContentClassKey, 14), 29,
       "Invalid metadata Content Class: 14 at @"},
      {"another user's persona", valid(), 29,
       "Incorrect UserId: 501, expecting: 502 for com.example.app at @", 502},
      {"persona wider than a user id",
       with(valid(), kKSTMetadataPersonaKey, std::uint64_t{501} + (std::uint64_t{1} << 32)), 29,
       "Incorrect UserId: 4294967797, expecting: 501 for com.example.app at @"},
      {"info that is no dictionary", with(valid(), kKSTMetadataInfoKey, "x"), 29,
       "Invalid metadata Info: x at @"},
      {"class of another directory", valid(), 29,
       "Invalid metadata-URLs should match: @ : " +
           fakes.scratch.resolve("/private/var/mobile/Containers/Data/Application"),
       501, "Data/VantlerPlugin"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    const KSTFileURL container = containerAt(row.classPath, "C" + std::to_string(&row - rows));
    if (const auto* dictionary = std::get_if<PlistDictionary>(&row.contents)) {
      writeDictionary(container, *dictionary);
    } else if (const auto* raw = std::get_if<std::string>(&row.contents)) {
      writeRaw(container, *raw);
    } else if (const auto* make = std::get_if<MakeFile>(&row.contents)) {
      (*make)(metadataPath(container));
    }
    fakes.logging->clear();
    KSTErrorRef error;
    EXPECT_EQ(KSTMetadata::readAndValidateMetadataAtUrl(container, row.user, true, &error),
              nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->domain(), kKSTErrorDomain);
    EXPECT_EQ(error->code(), static_cast<std::int64_t>(row.code));
    std::string expected = row.message;
    expected.replace(expected.find('@'), 1, container.path());
    EXPECT_EQ(messageOf(error), expected);
    EXPECT_TRUE(fakes.logged(expected));  // by the error builder
  }
}

TEST_F(MetadataTest, AcceptedFilesGiveARecordOfTheExpectedUser) {
  struct Row {
    const char* label;
    PlistDictionary contents;
    std::uint32_t user;
    bool checkClassPath;
    const char* classPath;
    KSTContainerClass containerClass;
  };
  const Row rows[] = {
      {"no persona, another mobile user", without(valid(), kKSTMetadataPersonaKey), 502, true,
       "Data/Application", 2},
      {"no persona, installer's bundle",
       without(with(valid(), kKSTMetadataContentClassKey, 1), kKSTMetadataPersonaKey), 33, true,
       "Bundle/Application", 1},
      {"another class directory, unchecked", valid(), 501, false, "Data/VantlerPlugin", 2},
      {"lower-case UUID and extra keys",
       with(with(valid(), kKSTMetadataUUIDKey, "6f1b2c3d-4e5f-4a6b-8c7d-9e0f1a2b3c4d"), "Other",
            PlistArray{1, 2}),
       501, true, "Data/Application", 2},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    const KSTFileURL container = containerAt(row.classPath, "C" + std::to_string(&row - rows));
    writeDictionary(container, row.contents);
    KSTErrorRef error;
    auto record =
        KSTMetadata::readAndValidateMetadataAtUrl(container, row.user, row.checkClassPath, &error);
    ASSERT_NE(record, nullptr) << FormatArg(error).description();
    EXPECT_EQ(record->uid(), row.user);
    EXPECT_EQ(record->identifier(), "com.example.app");
    EXPECT_EQ(record->containerClass(), row.containerClass);
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
  ASSERT_TRUE(record->writeMetadataToDiskWithError(&error)) << FormatArg(error).description();

  auto back = KSTMetadata::readAndValidateMetadataAtUrl(container, 501, true, &error);
  ASSERT_NE(back, nullptr) << FormatArg(error).description();
  EXPECT_EQ(back->uuid(), uuid);
  ASSERT_TRUE(back->info());
  EXPECT_EQ(PlistValue(*back->info()), PlistValue(info));

  const platform::UniqueFd fd(::open(metadataPath(container).c_str(), O_RDONLY));
  std::optional<std::int32_t> protectionClass;
  ASSERT_EQ(platform::getProtectionClass(fd.get(), &protectionClass), 0);
  EXPECT_EQ(protectionClass, 4);

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
}

TEST_F(MetadataTest, WriteFailuresGiveCode34WithTheWritersError) {
  struct Row {
    const char* label;
    KSTFileURL url;
    std::string identifier;
  };
  const Row rows[] = {
      {"missing directory", KSTFileURL(fakes.scratch.resolve("/nowhere/C"), true), "com.a"},
      {"identifier that is no UTF-8", containerAt("Data/Application", "BAD"),
       std::string("com.\xff\xfe")},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    auto record = KSTMetadata::initWithUserId(501, platform::Uuid::random(), 2, row.identifier,
                                              std::nullopt, row.url);
    KSTErrorRef error;
    EXPECT_FALSE(record->writeMetadataToDiskWithError(&error));
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->code(), 34);
    EXPECT_EQ(messageOf(error), "Failed to write metadata dictionary to URL " + row.url.path());
    EXPECT_NE(error->underlyingError(), nullptr);
    EXPECT_FALSE(fs::exists(metadataPath(row.url)));
  }
}

}  // namespace
}  // namespace kestrel
