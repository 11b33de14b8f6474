#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/code_signing_identity_linux.h"
#include "support/scratch_root.h"

namespace kestrel::platform {
namespace {

namespace fs = std::filesystem;
using testing::ScratchRoot;

constexpr const char* kAllowed = "com.zorvane.private.Kestrel.allowed";
constexpr const char* kLabel = "kestrel_client_t";

std::string stringItem(const std::string& key, const std::string& value) {
  return "<key>" + key + "</key><string>" + value + "</string>";
}

std::string document(const std::string& root) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">" + root +
         "</plist>\n";
}

// A registry entry; entitlementsBody nullptr leaves "Entitlements" out.
std::string entry(const std::string& identifier, const std::string& matchKey,
                  const std::string& matchValue, const char* entitlementsBody = "") {
  std::string body = stringItem("SigningIdentifier", identifier) + stringItem(matchKey, matchValue);
  if (entitlementsBody != nullptr) {
    body += "<key>Entitlements</key><dict>" + std::string(entitlementsBody) + "</dict>";
  }
  return document("<dict>" + body + "</dict>");
}

void setOwnerAndMode(const std::string& path, uid_t owner, mode_t mode) {
  ASSERT_EQ(::chown(path.c_str(), owner, owner), 0) << path;
  ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path;
}

// A scratch root with two registered client binaries, "alpha" (entitled to
// "allowed") and "beta" (entitled to "none"), each its own copy of /bin/true.
struct Registry {
  Registry() {
    fs::create_directories(path(""));
    setOwnerAndMode(path(""), 0, 0755);
    writeEntry("alpha.plist",
               entry("com.example.alpha", "Executable", path("alpha"), kAllowedBody));
    writeEntry("beta.plist", entry("com.example.beta", "Executable", path("beta"),
                                   "<key>com.zorvane.private.Kestrel.none</key><true/>"));
  }

  // "" is the registry directory, "*.plist" a file in it, anything else a
  // client binary as /proc/<pid>/exe would show it, installed (root-owned,
  // 0755) on first use.
  std::string path(const std::string& item) {
    const std::string directory = scratch.resolve("/etc/kestrel/signatures");
    if (item.empty() || item.ends_with(".plist"))
      return item.empty() ? directory : directory + "/" + item;
    const fs::path client = scratch.resolve("/usr/libexec/kestrel-clients/" + item);
    if (!fs::exists(client)) {
      fs::create_directories(client.parent_path());
      fs::copy_file("/bin/true", client);
      setOwnerAndMode(client, 0, 0755);
    }
    return fs::canonical(client).string();
  }

  // Writes a registry file in place (root-owned, 0644), or replaces it by a
  // rename as an operator's tools would.
  void writeEntry(const std::string& name, const std::string& contents, bool rename = false) {
    const std::string target = path(name);
    const std::string written = rename ? target + ".new" : target;
    std::ofstream(written, std::ios::binary | std::ios::trunc) << contents;
    setOwnerAndMode(written, 0, 0644);
    if (rename) fs::rename(written, target);
  }

  PeerCredentials peer(const std::optional<std::string>& executable,
                       const std::optional<std::string>& label = std::nullopt) const {
    PeerCredentials peer;
    peer.pid = 4242;
    peer.uid = peer.gid = 501;
    peer.executablePath = executable;
    peer.securityLabel = label;
    return peer;
  }

  static constexpr const char* kAllowedBody =
      "<key>com.zorvane.private.Kestrel.allowed</key><true/>";
  ScratchRoot scratch;
};

using Change = std::function<void(Registry&)>;

Change chmodTo(std::string item, uid_t owner, mode_t mode) {
  return [=](Registry& r) { setOwnerAndMode(r.path(item), owner, mode); };
}

// Writes `file` as a dictionary of `items`, plus the executable of `client` if any.
Change write(std::string file, std::string items, const char* client = nullptr) {
  return [=](Registry& r) {
    const std::string match = client != nullptr ? stringItem("Executable", r.path(client)) : "";
    r.writeEntry(file, document("<dict>" + items + match + "</dict>"));
  };
}

// A binary-format registry entry, made with libplist.
std::string binaryEntry(const std::string& identifier, const std::string& executable) {
  plist_t root = plist_new_dict();
  plist_dict_set_item(root, "SigningIdentifier", plist_new_string(identifier.c_str()));
  plist_dict_set_item(root, "Executable", plist_new_string(executable.c_str()));
  plist_t entitlements = plist_new_dict();
  plist_dict_set_item(entitlements, kAllowed, plist_new_bool(1));
  plist_dict_set_item(root, "Entitlements", entitlements);
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(root, &bytes, &length);
  std::string result(bytes, length);
  std::free(bytes);
  plist_free(root);
  return result;
}

TEST(CodeSigningIdentityTest, IdentifiesPeersFromTheRegistry) {
  const PlistDictionary allowed{{kAllowed, true}};
  const std::string gammaId = stringItem("SigningIdentifier", "com.example.gamma");
  struct Row {
    const char* name;
    Change change;           // made after the peer's binary is installed
    const char* executable;  // a client's name, or a path if it has a '/'; nullptr: none
    const char* label;
    std::string expected;  // the identifier, or "error: " and a part of the error
    std::optional<PlistDictionary> entitlements = std::nullopt;
  };
  const Row rows[] = {
      {"executable selects its entry", nullptr, "alpha", nullptr, "com.example.alpha", allowed},
      {"each copy of the binary is its own identity", nullptr, "beta", nullptr, "com.example.beta",
       PlistDictionary{{"com.zorvane.private.Kestrel.none", true}}},
      {"the label selects the entry over the executable",
       [](Registry& r) {
         r.writeEntry("labelled.plist", entry("com.example.labelled", "Label", kLabel));
       },
       "alpha", kLabel, "com.example.labelled", PlistDictionary{}},
      {"a labelled peer is not identified by its executable", nullptr, "alpha", "unregistered_t",
       "error: no registered identity for unregistered_t"},
      {"registry file writable by group is ignored", chmodTo("alpha.plist", 0, 0664), "alpha",
       nullptr, "error: alpha.plist is writable by group or others"},
      {"registry file not owned by root is ignored", chmodTo("alpha.plist", 501, 0644), "alpha",
       nullptr, "error: alpha.plist is not owned by root (owner 501)"},
      {"registry file that is a symbolic link is ignored",
       [](Registry& r) {
         fs::rename(r.path("alpha.plist"), r.scratch.resolve("/etc/alpha.plist"));
         fs::create_symlink(r.scratch.resolve("/etc/alpha.plist"), r.path("alpha.plist"));
       },
       "alpha", nullptr, "error: alpha.plist is a symbolic link"},
      {"executable writable by others is not trusted", chmodTo("alpha", 0, 0757), "alpha", nullptr,
       "error: is writable by group or others"},
      {"executable not owned by root is not trusted", chmodTo("alpha", 501, 0755), "alpha", nullptr,
       "error: is not owned by root (owner 501)"},
      {"registered executable that is gone", [](Registry& r) { fs::remove(r.path("alpha")); },
       "alpha", nullptr, "error: cannot be examined"},
      {"peer with neither label nor executable", nullptr, nullptr, nullptr,
       "error: no security label and no executable known for pid 4242"},
      {"entry without entitlements gives the identifier alone",
       write("gamma.plist", gammaId, "gamma"), "gamma", nullptr, "com.example.gamma"},
      {"binary property list",
       [](Registry& r) {
         r.writeEntry("gamma.plist", binaryEntry("com.example.gamma", r.path("gamma")));
       },
       "gamma", nullptr, "com.example.gamma", allowed},
      {"a malformed file does not spoil the others",
       [](Registry& r) {
         r.writeEntry("broken.plist", "<plist><dict><key>Sign");
         r.writeEntry("empty.plist", "");
         r.writeEntry("noise.plist", std::string("\0\1\2bplist00\xff", 12));
         // A binary list whose string holds a NUL byte, which libplist itself asserts on.
         std::ifstream in(std::string(KESTREL_SOURCE_DIR) +
                              "/fuzz/corpus/fuzz_signing_registry/string_with_nul.bplist",
                          std::ios::binary);
         ASSERT_TRUE(in);
         r.writeEntry("damaged.plist", std::string(std::istreambuf_iterator<char>(in), {}));
       },
       "alpha", nullptr, "com.example.alpha", allowed},
      {"identifier that is not a string",
       write("gamma.plist", "<key>SigningIdentifier</key><integer>7</integer>", "gamma"), "gamma",
       nullptr, "error: gamma.plist has no \"SigningIdentifier\" string"},
      {"entitlements that are not a dictionary",
       write("gamma.plist", gammaId + "<key>Entitlements</key><array/>", "gamma"), "gamma", nullptr,
       "error: gamma.plist has an \"Entitlements\" value that is not"},
      {"entry with both a label and an executable",
       write("gamma.plist", gammaId + stringItem("Label", kLabel), "gamma"), "gamma", nullptr,
       "error: gamma.plist must have exactly one of"},
      {"label that is not a string", write("gamma.plist", gammaId + "<key>Label</key><true/>"),
       "gamma", nullptr, "error: gamma.plist has a \"Label\" that is not"},
      {"executable that is not a normalized absolute path",
       [](Registry& r) {
         r.writeEntry("gamma.plist", entry("com.example.gamma", "Executable", "usr/libexec/gamma"));
         r.writeEntry("delta.plist",
                      entry("com.example.delta", "Executable", "/usr//libexec/delta"));
       },
       "usr/libexec/gamma", nullptr, "error: gamma.plist has an \"Executable\" that is not"},
      {"root that is not a dictionary",
       [](Registry& r) {
         r.writeEntry("gamma.plist", document("<array><string>x</string></array>"));
       },
       "gamma", nullptr, "error: gamma.plist is not a dictionary"},
      {"executable registered twice is ambiguous",
       write("gamma.plist", stringItem("SigningIdentifier", "com.example.beta"), "beta"), "beta",
       nullptr, "error: is registered more than once: beta.plist gamma.plist"},
      {"directory writable by group trusts nothing", chmodTo("", 0, 0775), "alpha", nullptr,
       "error: is not trusted: it is writable by group or others"},
      {"directory not owned by root trusts nothing", chmodTo("", 501, 0755), "alpha", nullptr,
       "error: is not trusted: it is not owned by root (owner 501)"},
      {"no registry directory", [](Registry& r) { fs::remove_all(r.path("")); }, "alpha", nullptr,
       "error: no registered identity for "},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    Registry registry;
    std::optional<std::string> executable;
    if (row.executable != nullptr) {
      const std::string name = row.executable;
      executable = name.find('/') != std::string::npos ? name : registry.path(name);
    }
    const PeerCredentials peer =
        registry.peer(executable, row.label ? std::optional<std::string>(row.label) : std::nullopt);
    if (row.change) row.change(registry);
    const CodeSigningIdentityResult result =
        LinuxCodeSigningIdentity(registry.scratch.root()).identify(peer);
    if (row.expected.starts_with("error: ")) {
      EXPECT_EQ(result.signingIdentifier, std::nullopt);
      EXPECT_EQ(result.entitlements, std::nullopt);
      EXPECT_NE(result.error.find(row.expected.substr(7)), std::string::npos) << result.error;
    } else {
      EXPECT_EQ(result.signingIdentifier, row.expected);
      EXPECT_EQ(result.entitlements, row.entitlements);
      EXPECT_EQ(result.error, "");
    }
  }
}

TEST(CodeSigningIdentityTest, ChangesToTheRegistryAreSeenByTheNextLookup) {
  Registry registry;
  LinuxCodeSigningIdentity identity(registry.scratch.root());
  const std::string alpha = registry.path("alpha");
  const std::string gamma = registry.path("gamma");
  const fs::path kestrel = fs::path(registry.path("")).parent_path();
  const auto entryFor = [](const char* identifier, const std::string& executable) {
    return entry(identifier, "Executable", executable);
  };
  struct Step {
    const char* name;
    Change change;
    const std::string& executable;
    const char* identifier;
  };
  const Step steps[] = {
      {"as registered", nullptr, alpha, "com.example.alpha"},
      {"file replaced by a rename",
       [&](Registry& r) {
         r.writeEntry("alpha.plist", entryFor("com.example.renamed", alpha), true);
       },
       alpha, "com.example.renamed"},
      {"file rewritten in place",
       [&](Registry& r) { r.writeEntry("alpha.plist", entryFor("com.example.in.place", alpha)); },
       alpha, "com.example.in.place"},
      {"file made group-writable", chmodTo("alpha.plist", 0, 0664), alpha, "(none)"},
      {"file made safe again", chmodTo("alpha.plist", 0, 0644), alpha, "com.example.in.place"},
      {"file added",
       [&](Registry& r) { r.writeEntry("gamma.plist", entryFor("com.example.gamma", gamma)); },
       gamma, "com.example.gamma"},
      {"file removed", [](Registry& r) { fs::remove(r.path("alpha.plist")); }, alpha, "(none)"},
      {"directory made writable by others", chmodTo("", 0, 0777), gamma, "(none)"},
      {"directory made safe again", chmodTo("", 0, 0755), gamma, "com.example.gamma"},
      // Changes on the way to the directory, which a watch of the directory
      // alone would not see.
      {"directory replaced by another one",
       [&](Registry& r) {
         fs::rename(r.path(""), kestrel / "signatures.old");
         fs::create_directory(r.path(""));
         setOwnerAndMode(r.path(""), 0, 0755);
         r.writeEntry("gamma.plist", entryFor("com.example.gamma.new", gamma));
       },
       gamma, "com.example.gamma.new"},
      {"the directory above it renamed away",
       [&](Registry&) { fs::rename(kestrel, kestrel.parent_path() / "kestrel.away"); }, gamma,
       "(none)"},
      {"the directory above it back again",
       [&](Registry&) { fs::rename(kestrel.parent_path() / "kestrel.away", kestrel); }, gamma,
       "com.example.gamma.new"},
  };
  for (const Step& step : steps) {
    SCOPED_TRACE(step.name);
    if (step.change) step.change(registry);
    EXPECT_EQ(
        identity.identify(registry.peer(step.executable)).signingIdentifier.value_or("(none)"),
        step.identifier);
  }
}

TEST(CodeSigningIdentityConcurrencyTest, LookupsWhileTheRegistryChanges) {
  Registry registry;
  LinuxCodeSigningIdentity identity(registry.scratch.root());
  const PeerCredentials alpha = registry.peer(registry.path("alpha"));
  std::atomic<bool> done = false;
  std::atomic<int> unexpected = 0;
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&] {
      while (!done) {
        const std::string id = identity.identify(alpha).signingIdentifier.value_or("");
        if (id != "com.example.alpha" && id != "com.example.other") ++unexpected;
      }
    });
  }
  for (int i = 0; i < 100; ++i) {
    const char* identifier = i % 2 == 0 ? "com.example.other" : "com.example.alpha";
    registry.writeEntry("alpha.plist", entry(identifier, "Executable", *alpha.executablePath),
                        true);
  }
  done = true;
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(unexpected, 0);
  EXPECT_EQ(identity.identify(alpha).signingIdentifier, "com.example.alpha");
}

// The binary a peer ran, as it was when it connected, is what must be
// trusted, not what lies at its path by the time it asks: a writable binary
// swapped for a safe one after connecting does not pass.
TEST(CodeSigningIdentityTest, TheBinaryOpenedAtConnectIsTheOneExamined) {
  Registry registry;
  const std::string path = registry.path("alpha");
  setOwnerAndMode(path, 1000, 0755);
  PeerCredentials peer = registry.peer(path);
  struct stat atConnect {};
  ASSERT_EQ(::stat(path.c_str(), &atConnect), 0);
  peer.executableStatus = atConnect;
  fs::copy_file("/bin/true", path + ".safe");
  setOwnerAndMode(path + ".safe", 0, 0755);
  fs::rename(path + ".safe", path);

  LinuxCodeSigningIdentity identity(registry.scratch.root());
  const CodeSigningIdentityResult result = identity.identify(peer);
  EXPECT_FALSE(result.signingIdentifier);
  EXPECT_NE(result.error.find("is not owned by root"), std::string::npos) << result.error;
  peer.executableStatus.reset();  // without what was read at connect, the path decides
  EXPECT_EQ(identity.identify(peer).signingIdentifier, "com.example.alpha");
}

}  // namespace
}  // namespace kestrel::platform
