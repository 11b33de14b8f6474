// What the store, code-signing and operations tests share: a fixture with the
// installer's client, containers made through it or written straight to disk,
// what the cache and the code-signing store then hold, readers of a file's
// owner, mode, class and ACL, and ways to run a command as a client would.
#pragma once

#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "codesigning/code_signing_mapping.h"
#include "daemon/client_connection.h"
#include "daemon/request_dispatch.h"
#include "platform/sandbox.h"
#include "store/metadata.h"
#include "support/fake_services.h"

namespace kestrel::testing {

// The error's message; "" without an error.
std::string messageOf(const KSTErrorRef& error);
// Whether there is an error with the code (in the domain, when one is named)
// and, when one is given, the message.
::testing::AssertionResult isError(const KSTErrorRef& error, std::int64_t code,
                                   std::optional<std::string> message = std::nullopt,
                                   const char* domain = nullptr);
inline ::testing::AssertionResult isPOSIXError(const KSTErrorRef& error, int code,
                                               std::optional<std::string> message = std::nullopt) {
  return isError(error, code, std::move(message), kPOSIXErrorDomain);
}

// lstat of a path; a failure is a test failure.
struct stat statOf(const std::string& path);
inline mode_t modeOf(const std::string& path) {
  return statOf(path).st_mode & 07777;
}
inline uid_t ownerOf(const std::string& path) {
  return statOf(path).st_uid;
}
// The data-protection class of a file or directory, if it has one.
std::optional<std::int32_t> protectionClassOf(const std::string& path);
// The kernel's access or default list as text with numeric ids; "<none>" without one.
std::string aclText(const std::string& path, acl_type_t type);
// The names in a directory, sorted; none when it does not exist.
std::vector<std::string> namesIn(const std::string& directory);

// The daemon's staging and death-row directories.
std::string stagingDirectory();
std::string deathRowDirectory();
// The class directory of a user's class (made when asked for).
std::string classDirectory(std::uint32_t user, KSTContainerClass containerClass,
                           bool transient = false);
// A container written without the daemon: a directory named by a fresh UUID in
// its class directory, with its metadata.
KSTMetadataRef writeContainer(std::uint32_t user, KSTContainerClass containerClass,
                              const std::string& identifier, bool transient = false,
                              std::optional<platform::Uuid> uuid = std::nullopt,
                              std::optional<PlistDictionary> info = std::nullopt);
// The info dictionary of the container as its metadata file holds it; a file
// that cannot be read is a test failure.
std::optional<PlistDictionary> infoOnDisk(const KSTMetadataRef& container);
// The live container the cache holds, if its directory is still there.
KSTMetadataRef existingContainer(std::uint32_t user, KSTContainerClass containerClass,
                                 const std::string& identifier);

// Code-signing information with these entitlements and one opaque key.
PlistDictionary infoWithEntitlements(PlistDictionary entitlements);
// Stores entries on the store's queue, as processing does.
KSTErrorRef storeEntries(KSTCodeSigningMapping& mapping, std::vector<KSTCodeSigningEntry> entries,
                         std::vector<std::string> identifiers);
// A copy of an identifier's stored entry.
std::optional<KSTCodeSigningEntry> storedEntry(
    const std::string& identifier,
    KSTCodeSigningMapping& mapping = KSTCodeSigningMapping::sharedInstance());

// A request made of a dictionary's keys and values.
platform::MessageDictionary request(const PlistDictionary& keys);
// Runs a command handler on a request from the client; gives the request's code.
std::uint64_t runHandler(void (*handler)(KSTCommandContext&), KSTClientConnection& client,
                         const platform::MessageDictionary& request,
                         platform::MessageDictionary* reply = nullptr);

// Removals of `identifier` (of any, when empty) run the hook first, once.
class HookedSandbox final : public platform::Sandbox {
 public:
  int setUserStateItem(std::uint32_t, std::uint64_t, const std::string& identifier,
                       const std::optional<std::string>& path, std::uint64_t) override;
  std::optional<std::string> userStateItem(std::uint32_t, std::uint64_t,
                                           const std::string&) const override {
    return std::nullopt;
  }
  std::vector<platform::SandboxUserStateItem> userStateItems() const override { return {}; }

  std::string identifier;
  std::function<void()> hook;
  std::vector<std::string> removals;
};
// Leaves the container's class directory unlistable: its class map dropped,
// the directory moved aside and a file in its place.
void breakClassDirectory(const KSTMetadataRef& container);

// Every platform service faked, and the installer's client. Death-row sweeps
// that a test started (transient renewals, failed creations) end before the
// scratch root goes.
class StoreTest : public ::testing::Test {
 protected:
  ~StoreTest() override;

  // Creates (or finds) a container through the installer; a failure is a test failure.
  KSTMetadataRef make(std::uint32_t user, KSTContainerClass containerClass,
                      const std::string& identifier, bool transient = false);
  // Uses the sandbox given for the rest of the test.
  void useSandbox(std::shared_ptr<platform::Sandbox> sandbox);
  // Starts the request listener and connects an allowed client to it.
  void connectThroughDispatcher(const std::string& identifier = "com.example.installer");
  // Delivers a request on that connection and gives its reply's code.
  std::uint64_t ask(const platform::MessageDictionary& request);

  FakeServices fakes;
  KSTClientConnection installer{std::string("com.example.installer"), 0, true, std::nullopt};
  std::shared_ptr<platform::FakeMessageConnection> connection;
};

}  // namespace kestrel::testing
