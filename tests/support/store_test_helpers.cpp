#include "support/store_test_helpers.h"

#include <acl/libacl.h>
#include <fcntl.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <utility>

#include "daemon/daemon_state.h"
#include "daemon/error_codes.h"
#include "platform/data_protection.h"
#include "platform/linux/extended_acl_linux.h"
#include "platform/unique_fd.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"

namespace kestrel::testing {

namespace fs = std::filesystem;

std::string messageOf(const KSTErrorRef& error) {
  return error ? error->localizedDescription().value_or("") : "";
}

::testing::AssertionResult isError(const KSTErrorRef& error, std::int64_t code,
                                   std::optional<std::string> message, const char* domain) {
  if (!error) return ::testing::AssertionFailure() << "no error";
  if (error->code() != code || (domain && error->domain() != domain) ||
      (message && messageOf(error) != *message)) {
    return ::testing::AssertionFailure()
           << "got " << error->domain() << " " << error->code() << ": " << messageOf(error);
  }
  return ::testing::AssertionSuccess();
}

struct stat statOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
  return st;
}

std::optional<std::int32_t> protectionClassOf(const std::string& path) {
  const platform::UniqueFd fd(::open(path.c_str(), O_RDONLY));
  std::optional<std::int32_t> protectionClass;
  EXPECT_EQ(platform::getProtectionClass(fd.get(), &protectionClass), 0) << path;
  return protectionClass;
}

std::string aclText(const std::string& path, acl_type_t type) {
  const platform::UniquePosixACL acl(acl_get_file(path.c_str(), type));
  if (!acl) return "<none>";
  char* text = acl_to_any_text(acl.get(), nullptr, ',', TEXT_NUMERIC_IDS);
  std::string result = text;
  acl_free(text);
  return result;
}

std::vector<std::string> namesIn(const std::string& directory) {
  std::vector<std::string> names;
  if (!fs::exists(directory)) return names;
  for (const auto& entry : fs::directory_iterator(directory))
    names.push_back(entry.path().filename());
  std::sort(names.begin(), names.end());
  return names;
}

std::string stagingDirectory() {
  return KSTGlobalConfiguration::sharedInstance().stagingDirectory().path();
}

std::string deathRowDirectory() {
  return KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
}

std::string classDirectory(std::uint32_t user, KSTContainerClass containerClass, bool transient) {
  auto url = KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
      user, containerClass, transient);
  EXPECT_TRUE(url.has_value());
  return url.value_or(KSTFileURL()).path();
}

KSTMetadataRef writeContainer(std::uint32_t user, KSTContainerClass containerClass,
                              const std::string& identifier, bool transient,
                              std::optional<platform::Uuid> uuid,
                              std::optional<PlistDictionary> info) {
  const KSTFileURL url(
      classDirectory(user, containerClass, transient) + "/" + platform::Uuid::random().string(),
      true);
  fs::create_directories(url.path());
  auto record = KSTMetadata::initWithUserId(user, uuid.value_or(platform::Uuid::random()),
                                            containerClass, identifier, std::move(info), url);
  record->setTransient(transient);
  KSTErrorRef error;
  EXPECT_TRUE(record->writeMetadataToDiskWithError(&error)) << messageOf(error);
  return record;
}

std::optional<PlistDictionary> infoOnDisk(const KSTMetadataRef& container) {
  KSTErrorRef error;
  auto read =
      KSTMetadata::readAndValidateMetadataAtUrl(container->url(), container->uid(), true, &error);
  EXPECT_TRUE(read) << messageOf(error);
  return read ? read->info() : std::nullopt;
}

KSTMetadataRef existingContainer(std::uint32_t user, KSTContainerClass containerClass,
                                 const std::string& identifier) {
  KSTErrorRef error;
  KSTMetadataRef found = KSTContainerCache::sharedInstance().containerForUser(
      user, containerClass, identifier, false, &error);
  return found && fs::exists(found->url().path()) ? found : nullptr;
}

PlistDictionary infoWithEntitlements(PlistDictionary entitlements) {
  return PlistDictionary{{kKSTEntitlementsKey, std::move(entitlements)}, {"Opaque", "kept"}};
}

KSTErrorRef storeEntries(KSTCodeSigningMapping& mapping, std::vector<KSTCodeSigningEntry> entries,
                         std::vector<std::string> identifiers) {
  return mapping.withState(KSTErrorRef(), [&](KSTCodeSigningMappingState& state) {
    return state._setCodeSigningDictionaryValues(entries, identifiers);
  });
}

std::optional<KSTCodeSigningEntry> storedEntry(const std::string& identifier,
                                               KSTCodeSigningMapping& mapping) {
  return mapping.withState(
      std::optional<KSTCodeSigningEntry>(), [&](KSTCodeSigningMappingState& state) {
        const KSTCodeSigningEntry* found = state.entryForIdentifier(identifier);
        return found ? std::optional(*found) : std::nullopt;
      });
}

platform::MessageDictionary request(const PlistDictionary& keys) {
  auto made = platform::MessageDictionary::fromPlist(keys);
  EXPECT_TRUE(made.has_value());
  return made.value_or(platform::MessageDictionary{});
}

std::uint64_t runHandler(void (*handler)(KSTCommandContext&), KSTClientConnection& client,
                         const platform::MessageDictionary& request,
                         platform::MessageDictionary* reply) {
  platform::MessageDictionary unused;
  std::uint64_t code = kKSTSuccess;
  const KSTDeferredReply deferred(nullptr, platform::ReceivedMessage(request, nullptr, nullptr));
  KSTCommandContext context{request, reply ? *reply : unused, client, &code, deferred};
  handler(context);
  return code;
}

int HookedSandbox::setUserStateItem(std::uint32_t, std::uint64_t, const std::string& removed,
                                    const std::optional<std::string>& path, std::uint64_t) {
  if (path) return 0;
  removals.push_back(removed);
  if ((identifier.empty() || removed == identifier) && hook) std::exchange(hook, nullptr)();
  return 0;
}

void breakClassDirectory(const KSTMetadataRef& container) {
  const fs::path directory = fs::path(container->url().path()).parent_path();
  KSTContainerCache::sharedInstance()._discardClassMapForUser(
      container->uid(), container->containerClass(), container->transient());
  fs::rename(directory, directory.string() + ".aside");
  std::ofstream(directory.string()) << "not a directory";
}

StoreTest::~StoreTest() {
  KSTDeathRowQueue()->sync([] {});
}

KSTMetadataRef StoreTest::make(std::uint32_t user, KSTContainerClass containerClass,
                               const std::string& identifier, bool transient) {
  std::uint64_t code = kKSTSuccess;
  KSTMetadataRef made = installer.createOrLookupContainerForUser(
      user, identifier, true, containerClass, transient, true, &code);
  EXPECT_TRUE(made) << "code " << code;
  return made;
}

void StoreTest::useSandbox(std::shared_ptr<platform::Sandbox> sandbox) {
  fakes.services.sandbox = std::move(sandbox);
  fakes.install();
}

void StoreTest::connectThroughDispatcher(const std::string& identifier) {
  ASSERT_TRUE(KSTStartRequestListener(platform::DispatchQueue::createConcurrent("test.listener")));
  connection = fakes.connectAllowedClient(identifier);
}

std::uint64_t StoreTest::ask(const platform::MessageDictionary& request) {
  EXPECT_TRUE(connection->deliver(request));
  const auto reply = connection->lastReply();
  EXPECT_TRUE(reply.has_value());
  return reply ? reply->uint64(kKSTReplyErrorKey) : ~std::uint64_t{0};
}

}  // namespace kestrel::testing
