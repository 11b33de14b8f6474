// Processing code-signing information: what an identifier's new entitlements
// take away (system container, group containers), how plug-ins join their
// parents, and that unchanged information writes nothing.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <thread>
#include <utility>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/command_handlers.h"
#include "daemon/error_codes.h"
#include "daemon/locks.h"
#include "platform/sandbox.h"
#include "store/container_cache.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;
using Strings = std::vector<std::string>;

PlistDictionary infoWith(PlistDictionary entitlements) {
  return PlistDictionary{{kKSTEntitlementsKey, std::move(entitlements)}, {"Opaque", "kept"}};
}

// The first removal of a sandbox mapping runs the hook.
class HookedSandbox final : public platform::Sandbox {
 public:
  int setUserStateItem(std::uint32_t, std::uint64_t, const std::string&,
                       const std::optional<std::string>& path, std::uint64_t) override {
    if (!path && hook) std::exchange(hook, nullptr)();
    return 0;
  }
  std::optional<std::string> userStateItem(std::uint32_t, std::uint64_t,
                                           const std::string&) const override {
    return std::nullopt;
  }
  std::vector<platform::SandboxUserStateItem> userStateItems() const override { return {}; }

  std::function<void()> hook;
};

class CodeSigningProcessingTest : public ::testing::Test {
 protected:
  static std::uint64_t process(std::optional<PlistDictionary> info,
                               std::optional<std::string> identifier,
                               std::optional<PlistDictionary> options = std::nullopt) {
    return KSTCodeSigningMapping::sharedInstance().processCodeSigningInfo(info, identifier,
                                                                          options);
  }
  static std::optional<KSTCodeSigningEntry> entry(const std::string& identifier) {
    return KSTCodeSigningMapping::sharedInstance().withState(
        std::optional<KSTCodeSigningEntry>(),
        [&](KSTCodeSigningMappingState& state) -> std::optional<KSTCodeSigningEntry> {
          const KSTCodeSigningEntry* found = state.entryForIdentifier(identifier);
          if (found == nullptr) return std::nullopt;
          return *found;
        });
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

  KSTMetadataRef make(std::uint32_t user, KSTContainerClass containerClass,
                      const std::string& identifier) {
    std::uint64_t code = kKSTSuccess;
    KSTMetadataRef made = installer.createOrLookupContainerForUser(
        user, identifier, true, containerClass, false, true, &code);
    EXPECT_TRUE(made) << code;
    return made;
  }
  static bool exists(std::uint32_t user, KSTContainerClass containerClass,
                     const std::string& identifier) {
    KSTErrorRef error;
    const KSTMetadataRef found = KSTContainerCache::sharedInstance().containerForUser(
        user, containerClass, identifier, false, &error);
    return found && fs::exists(found->url().path());
  }

  testing::FakeServices fakes;
  KSTClientConnection installer{std::string("com.example.installer"), 0, true, std::nullopt};
};

TEST_F(CodeSigningProcessingTest, SameInformationTwiceWritesNothingTheSecondTime) {
  const PlistDictionary info = infoWith(
      {{kKSTApplicationGroupsEntitlement, "group.a"}, {kKSTSystemContainerEntitlement, true}});
  const PlistDictionary options{{kKSTDataContainerClassOption, std::uint64_t{2}},
                                {kKSTPlaceholderEntitlementsOption, true}};
  ASSERT_EQ(process(info, "com.example.app", options), kKSTSuccess);
  ASSERT_EQ(writes(), 1u);
  const auto stored = entry("com.example.app");
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
  struct Row {
    const char* label;
    PlistDictionary entitlements;
    bool kept;
  };
  const Row rows[] = {
      {"entitlement gone", {}, false},
      {"entitlement NO", {{kKSTSystemContainerEntitlement, false}}, false},
      {"entitlement still YES", {{kKSTSystemContainerEntitlement, true}}, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.label);
    const std::string identifier = std::string("com.example.") + std::to_string(&row - rows);
    ASSERT_EQ(process(infoWith({{kKSTSystemContainerEntitlement, true}}), identifier), kKSTSuccess);
    const KSTMetadataRef container = make(499, kKSTContainerClassDataSystem, identifier);
    ASSERT_TRUE(container);

    EXPECT_EQ(process(infoWith(row.entitlements), identifier), kKSTSuccess);
    EXPECT_EQ(fs::exists(container->url().path()), row.kept);
    EXPECT_EQ(fakes.logging->containsMessage("Deleting system container for ID: " + identifier +
                                             " because it is no longer in the entitlements"),
              !row.kept);
  }
}

TEST_F(CodeSigningProcessingTest, AFailedSystemContainerStagingIsLoggedOnly) {
  auto sandbox = std::make_shared<HookedSandbox>();
  fakes.services.sandbox = sandbox;
  fakes.install();
  ASSERT_EQ(process(infoWith({{kKSTSystemContainerEntitlement, true}}), "com.example.app"),
            kKSTSuccess);
  const KSTMetadataRef container = make(499, kKSTContainerClassDataSystem, "com.example.app");
  ASSERT_TRUE(container);
  // The cache cannot drop the staged container: its class directory is gone.
  sandbox->hook = [&] {
    const fs::path classDirectory = fs::path(container->url().path()).parent_path();
    KSTContainerCache::sharedInstance()._discardClassMapForUser(499, kKSTContainerClassDataSystem,
                                                                false);
    fs::rename(classDirectory, classDirectory.string() + ".aside");
    std::ofstream(classDirectory.string()) << "not a directory";
  };

  EXPECT_EQ(process(infoWith({}), "com.example.app"), kKSTSuccess);
  EXPECT_FALSE(sandbox->hook);
  EXPECT_TRUE(fakes.logging->containsMessage(
      "Failed to destroy system container with identifier com.example.app: " +
      std::to_string(kKSTErrorCacheRemoveFailed)));
  EXPECT_FALSE(
      KSTCodeSigningMapping::sharedInstance().identifierHasSystemContainer("com.example.app"));
}

TEST_F(CodeSigningProcessingTest, DroppingTheLastReferenceRemovesTheGroupContainer) {
  ASSERT_EQ(
      process(
          infoWith({{kKSTApplicationGroupsEntitlement, PlistArray{"group.only", "group.shared"}}}),
          "com.example.one"),
      kKSTSuccess);
  ASSERT_EQ(
      process(infoWith({{kKSTApplicationGroupsEntitlement, "group.shared"}}), "com.example.two"),
      kKSTSuccess);
  make(501, kKSTContainerClassSharedAppGroup, "group.only");
  make(501, kKSTContainerClassSharedAppGroup, "group.shared");

  EXPECT_EQ(process(infoWith({}), "com.example.one"), kKSTSuccess);
  EXPECT_FALSE(exists(501, kKSTContainerClassSharedAppGroup, "group.only"));
  EXPECT_TRUE(exists(501, kKSTContainerClassSharedAppGroup, "group.shared"));

  // Removing the other one lets go of the last reference to the shared group.
  EXPECT_EQ(process(std::nullopt, "com.example.two"), kKSTSuccess);
  EXPECT_FALSE(exists(501, kKSTContainerClassSharedAppGroup, "group.shared"));
  EXPECT_FALSE(entry("com.example.two"));
}

TEST_F(CodeSigningProcessingTest, PlugInsJoinAParentThatHasAnEntryOnce) {
  ASSERT_EQ(process(infoWith({}), "com.example.app"), kKSTSuccess);
  const PlistDictionary child{{kKSTParentBundleIDOption, "com.example.app"}};
  for (int run = 0; run < 2; ++run) {
    EXPECT_EQ(process(infoWith({}), "com.example.app.ext", child), kKSTSuccess);
    EXPECT_EQ(entry("com.example.app")->childBundleIdentifiers(), Strings{"com.example.app.ext"});
  }
  EXPECT_EQ(writes(), 2u);  // the parent's and the plug-in's entries, once

  // The parent keeps its child when it is processed again.
  EXPECT_EQ(process(infoWith({{"more", true}}), "com.example.app"), kKSTSuccess);
  EXPECT_EQ(entry("com.example.app")->childBundleIdentifiers(), Strings{"com.example.app.ext"});

  EXPECT_EQ(process(infoWith({}), "com.example.orphan.ext",
                    PlistDictionary{{kKSTParentBundleIDOption, "com.example.missing"}}),
            kKSTSuccess);
  EXPECT_TRUE(entry("com.example.orphan.ext"));
  EXPECT_FALSE(entry("com.example.missing"));
}

TEST_F(CodeSigningProcessingTest, NothingToRemoveAndNoIdentifier) {
  EXPECT_EQ(process(std::nullopt, "com.example.unknown"), kKSTSuccess);
  EXPECT_EQ(process(infoWith({}), std::nullopt), kKSTErrorMissingIdentifier);
  EXPECT_EQ(firstLineStartingWith("Staging Code Signing Mapping"), fakes.logging->lines().size());
  EXPECT_EQ(writes(), 0u);
}

TEST_F(CodeSigningProcessingTest, RemovalProcessesTheChildrenFirst) {
  ASSERT_EQ(process(infoWith({{kKSTApplicationGroupsEntitlement, "group.app"}}), "com.example.app"),
            kKSTSuccess);
  const PlistDictionary child{{kKSTParentBundleIDOption, "com.example.app"}};
  ASSERT_EQ(process(infoWith({{kKSTApplicationGroupsEntitlement, "group.ext"}}),
                    "com.example.app.ext", child),
            kKSTSuccess);
  make(501, kKSTContainerClassSharedAppGroup, "group.app");
  make(501, kKSTContainerClassSharedAppGroup, "group.ext");

  fakes.logging->clear();
  KSTCodeSigningMapping::sharedInstance().removeCodeSigningDictionariesForIdentifierAndItsChildren(
      "com.example.app");
  EXPECT_FALSE(entry("com.example.app"));
  EXPECT_FALSE(entry("com.example.app.ext"));
  // Each released its group on the way out, the plug-in first.
  EXPECT_FALSE(exists(501, kKSTContainerClassSharedAppGroup, "group.app"));
  EXPECT_FALSE(exists(501, kKSTContainerClassSharedAppGroup, "group.ext"));
  const std::size_t plugIn =
      firstLineStartingWith("Staging Code Signing Mapping for ID: com.example.app.ext");
  const std::size_t app =
      firstLineStartingWith("Staging Code Signing Mapping for ID: com.example.app :");
  EXPECT_LT(plugIn, app);
  EXPECT_LT(app, fakes.logging->lines().size());
}

TEST_F(CodeSigningProcessingTest, CommandEighteenTakesDictionariesOnly) {
  KSTClientConnection client(std::string("com.example.installer"), 0, true, std::nullopt);
  auto run = [&](std::optional<PlistValue> info, std::optional<PlistValue> options,
                 bool withIdentifier = true) {
    platform::MessageDictionary request, reply;
    if (info) request.setPlist("CodeSigningInfo", *info);
    if (options) request.setPlist("OptionsDictionary", *options);
    if (withIdentifier) request.setString("Identifier", "com.example.app");
    std::uint64_t code = kKSTSuccess;
    const KSTDeferredReply deferred(nullptr, platform::ReceivedMessage(request, nullptr, nullptr));
    KSTCommandContext context{request, reply, client, &code, deferred};
    KSTHandleProcessCodeSigningInfo(context);
    return code;
  };
  EXPECT_EQ(run(PlistValue(infoWith({})), PlistValue("not options")), kKSTSuccess);
  ASSERT_TRUE(entry("com.example.app"));
  EXPECT_EQ(entry("com.example.app")->dataContainerClass(), 0u);
  EXPECT_EQ(run(PlistValue(infoWith({})), std::nullopt, false), kKSTErrorMissingIdentifier);
  EXPECT_TRUE(entry("com.example.app"));
  // Information that is not a dictionary removes the entry.
  EXPECT_EQ(run(PlistValue(PlistArray{"x"}), std::nullopt), kKSTSuccess);
  EXPECT_FALSE(entry("com.example.app"));
}

// Unchanged caller-registered entitlements are answered without the lock on
// all identifiers: a request of such a client does not wait behind a
// creation holding it. Changed ones do wait for it.
TEST(CodeSigningProcessingConcurrencyTest, UnchangedCallerEntitlementsDoNotTakeTheLock) {
  testing::FakeServices fakes;
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
