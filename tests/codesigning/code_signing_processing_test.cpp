// Processing code-signing information: what an identifier's new entitlements
// take away (system container, group containers), how plug-ins join their
// parents, and that unchanged information writes nothing.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <thread>

#include "codesigning/code_signing_mapping.h"
#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "daemon/locks.h"
#include "support/store_test_helpers.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using testing::existingContainer;
using testing::infoWithEntitlements;
using testing::storedEntry;
using Strings = std::vector<std::string>;
constexpr KSTContainerClass kAppGroup = kKSTContainerClassSharedAppGroup;

class CodeSigningProcessingTest : public testing::StoreTest {
 protected:
  static std::uint64_t process(std::optional<PlistDictionary> info,
                               std::optional<std::string> identifier,
                               std::optional<PlistDictionary> options = std::nullopt) {
    return KSTCodeSigningMapping::sharedInstance().processCodeSigningInfo(info, identifier,
                                                                          options);
  }
  static PlistDictionary groups(PlistValue groups) {
    return infoWithEntitlements({{kKSTApplicationGroupsEntitlement, std::move(groups)}});
  }
  std::size_t writes() const {
    return fakes.countLogged("Wrote code signing mappings to disk after set");
  }
  std::size_t firstLineStartingWith(const std::string& prefix) const {
    const auto lines = fakes.logging->lines();
    for (std::size_t i = 0; i < lines.size(); ++i) {
      if (lines[i].message.starts_with(prefix)) return i;
    }
    return lines.size();
  }
};

TEST_F(CodeSigningProcessingTest, SameInformationTwiceWritesNothingTheSecondTime) {
  EXPECT_EQ(process(std::nullopt, "com.example.unknown"), kKSTSuccess);
  EXPECT_EQ(process(infoWithEntitlements({}), std::nullopt), kKSTErrorMissingIdentifier);
  EXPECT_EQ(firstLineStartingWith("Staging Code Signing Mapping"), fakes.logging->lines().size());
  EXPECT_EQ(writes(), 0u);

  const PlistDictionary info = infoWithEntitlements(
      {{kKSTApplicationGroupsEntitlement, "group.a"}, {kKSTSystemContainerEntitlement, true}});
  const PlistDictionary options{{kKSTDataContainerClassOption, std::uint64_t{2}},
                                {kKSTPlaceholderEntitlementsOption, true}};
  ASSERT_EQ(process(info, "com.example.app", options), kKSTSuccess);
  ASSERT_EQ(writes(), 1u);
  const auto stored = storedEntry("com.example.app");
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->dataContainerClass(), 2u);
  EXPECT_TRUE(stored->placeholder());
  EXPECT_EQ(process(info, "com.example.app", options), kKSTSuccess);
  EXPECT_EQ(writes(), 1u);
  // Another option is a change.
  EXPECT_EQ(process(info, "com.example.app", PlistDictionary{{kKSTRegisteredByCallerOption, true}}),
            kKSTSuccess);
  EXPECT_EQ(writes(), 2u);
}

TEST_F(CodeSigningProcessingTest, LosingTheSystemContainerEntitlementStagesTheContainer) {
  const struct {
    PlistDictionary entitlements;
    bool kept;
  } rows[] = {
      {{}, false},
      {{{kKSTSystemContainerEntitlement, false}}, false},
      {{{kKSTSystemContainerEntitlement, true}}, true},
  };
  for (const auto& row : rows) {
    const std::string identifier = "com.example." + std::to_string(&row - rows);
    SCOPED_TRACE(identifier);
    ASSERT_EQ(process(infoWithEntitlements({{kKSTSystemContainerEntitlement, true}}), identifier),
              kKSTSuccess);
    const KSTMetadataRef container = make(499, kKSTContainerClassDataSystem, identifier);
    ASSERT_TRUE(container);
    EXPECT_EQ(process(infoWithEntitlements(row.entitlements), identifier), kKSTSuccess);
    EXPECT_EQ(fs::exists(container->url().path()), row.kept);
    EXPECT_EQ(fakes.logging->containsMessage("Deleting system container for ID: " + identifier +
                                             " because it is no longer in the entitlements"),
              !row.kept);
  }
}

TEST_F(CodeSigningProcessingTest, AFailedSystemContainerStagingIsLoggedOnly) {
  auto sandbox = std::make_shared<testing::HookedSandbox>();
  useSandbox(sandbox);
  ASSERT_EQ(
      process(infoWithEntitlements({{kKSTSystemContainerEntitlement, true}}), "com.example.app"),
      kKSTSuccess);
  const KSTMetadataRef container = make(499, kKSTContainerClassDataSystem, "com.example.app");
  ASSERT_TRUE(container);
  // The cache cannot drop the staged container: its class directory is gone.
  sandbox->hook = [&] { testing::breakClassDirectory(container); };
  EXPECT_EQ(process(infoWithEntitlements({}), "com.example.app"), kKSTSuccess);
  EXPECT_FALSE(sandbox->hook);
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Failed to destroy system container with identifier com.example.app: " +
      std::to_string(kKSTErrorCacheRemoveFailed)));
  EXPECT_FALSE(
      KSTCodeSigningMapping::sharedInstance().identifierHasSystemContainer("com.example.app"));
}

TEST_F(CodeSigningProcessingTest, DroppingTheLastReferenceRemovesTheGroupContainer) {
  ASSERT_EQ(process(groups(PlistArray{"group.only", "group.shared"}), "com.example.one"),
            kKSTSuccess);
  ASSERT_EQ(process(groups("group.shared"), "com.example.two"), kKSTSuccess);
  make(501, kAppGroup, "group.only");
  make(501, kAppGroup, "group.shared");
  EXPECT_EQ(process(infoWithEntitlements({}), "com.example.one"), kKSTSuccess);
  EXPECT_FALSE(existingContainer(501, kAppGroup, "group.only"));
  EXPECT_TRUE(existingContainer(501, kAppGroup, "group.shared"));
  // Removing the other one lets go of the last reference to the shared group.
  EXPECT_EQ(process(std::nullopt, "com.example.two"), kKSTSuccess);
  EXPECT_FALSE(existingContainer(501, kAppGroup, "group.shared"));
  EXPECT_FALSE(storedEntry("com.example.two"));
}

TEST_F(CodeSigningProcessingTest, PlugInsJoinAParentOnceAndAreRemovedBeforeIt) {
  ASSERT_EQ(process(groups("group.app"), "com.example.app"), kKSTSuccess);
  const PlistDictionary child{{kKSTParentBundleIDOption, "com.example.app"}};
  for (int run = 0; run < 2; ++run) {
    EXPECT_EQ(process(groups("group.ext"), "com.example.app.ext", child), kKSTSuccess);
    EXPECT_EQ(storedEntry("com.example.app")->childBundleIdentifiers(),
              Strings{"com.example.app.ext"});
  }
  EXPECT_EQ(writes(), 2u);  // the parent's entry, then the plug-in's with the parent's child, once
  // The parent keeps its child when it is processed again with new information.
  EXPECT_EQ(process(groups(PlistArray{"group.app", "group.more"}), "com.example.app"), kKSTSuccess);
  EXPECT_EQ(storedEntry("com.example.app")->childBundleIdentifiers(),
            Strings{"com.example.app.ext"});
  // A parent without an entry gets none.
  EXPECT_EQ(process(infoWithEntitlements({}), "com.example.orphan.ext",
                    PlistDictionary{{kKSTParentBundleIDOption, "com.example.missing"}}),
            kKSTSuccess);
  EXPECT_TRUE(storedEntry("com.example.orphan.ext"));
  EXPECT_FALSE(storedEntry("com.example.missing"));

  // Removal takes the plug-in first; each releases its group on the way out.
  make(501, kAppGroup, "group.app");
  make(501, kAppGroup, "group.ext");
  fakes.logging->clear();
  KSTCodeSigningMapping::sharedInstance().removeCodeSigningDictionariesForIdentifierAndItsChildren(
      "com.example.app");
  EXPECT_FALSE(storedEntry("com.example.app"));
  EXPECT_FALSE(storedEntry("com.example.app.ext"));
  EXPECT_FALSE(existingContainer(501, kAppGroup, "group.app"));
  EXPECT_FALSE(existingContainer(501, kAppGroup, "group.ext"));
  const std::size_t plugIn =
      firstLineStartingWith("Staging Code Signing Mapping for ID: com.example.app.ext");
  const std::size_t app =
      firstLineStartingWith("Staging Code Signing Mapping for ID: com.example.app :");
  EXPECT_LT(plugIn, app);
  EXPECT_LT(app, fakes.logging->lines().size());
}

TEST_F(CodeSigningProcessingTest, CommandEighteenTakesDictionariesOnly) {
  auto run = [&](PlistDictionary request) {
    request.emplace("Identifier", "com.example.app");
    return testing::runHandler(KSTHandleProcessCodeSigningInfo, installer,
                               testing::request(request));
  };
  EXPECT_EQ(run({{"CodeSigningInfo", infoWithEntitlements({})}, {"OptionsDictionary", "no"}}),
            kKSTSuccess);
  ASSERT_TRUE(storedEntry("com.example.app"));
  EXPECT_EQ(storedEntry("com.example.app")->dataContainerClass(), 0u);
  EXPECT_EQ(testing::runHandler(KSTHandleProcessCodeSigningInfo, installer,
                                testing::request({{"CodeSigningInfo", infoWithEntitlements({})}})),
            kKSTErrorMissingIdentifier);
  EXPECT_TRUE(storedEntry("com.example.app"));
  // Information that is not a dictionary removes the entry.
  EXPECT_EQ(run({{"CodeSigningInfo", PlistArray{"x"}}}), kKSTSuccess);
  EXPECT_FALSE(storedEntry("com.example.app"));
}

using CodeSigningProcessingConcurrencyTest = CodeSigningProcessingTest;

// Unchanged caller-registered entitlements are answered without the lock on
// all identifiers: a request of such a client does not wait behind a
// creation holding it. Changed ones do wait for it.
TEST_F(CodeSigningProcessingConcurrencyTest, UnchangedCallerEntitlementsDoNotTakeTheLock) {
  KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance();
  const PlistDictionary entitlements{{"com.zorvane.private.Kestrel.none", true}};
  ASSERT_EQ(mapping.processCallerRegisteredEntitlements(entitlements, "com.example.app"),
            kKSTSuccess);
  std::promise<void> held, release;
  std::thread holder([&] {
    KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
    held.set_value();
    release.get_future().wait();
  });
  held.get_future().wait();
  auto unchanged = std::async(std::launch::async, [&] {
    return mapping.processCallerRegisteredEntitlements(entitlements, "com.example.app");
  });
  EXPECT_EQ(unchanged.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  auto changed = std::async(std::launch::async, [&] {
    return mapping.processCallerRegisteredEntitlements(
        PlistDictionary{{"com.zorvane.private.Kestrel.allowed", true}}, "com.example.app");
  });
  EXPECT_EQ(changed.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
  release.set_value();
  holder.join();
  EXPECT_EQ(unchanged.get(), kKSTSuccess);
  EXPECT_EQ(changed.get(), kKSTSuccess);
  EXPECT_TRUE(mapping.identifierHasCallerRegisteredEntitlements("com.example.app"));
}

}  // namespace
}  // namespace kestrel
