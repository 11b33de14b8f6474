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
constexpr const char* kNone = "com.zorvane.private.Kestrel.none";
constexpr const char* kLabel = "kestrel_client_t";

std::string plistDocument(const std::string& root) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n" + root +
         "\n</plist>\n";
}

std::string stringItem(const std::string& key, const std::string& value) {
  return "<key>" + key + "</key><string>" + value + "</string>";
}

// A registry entry; entitlementsBody nullptr leaves "Entitlements" out.
std::string entry(const std::string& identifier, const std::string& matchKey,
                  const std::string& matchValue, const char* entitlementsBody = "") {
  std::string body = stringItem("SigningIdentifier", identifier) + stringItem(matchKey, matchValue);
  if (entitlementsBody != nullptr) {
    body += "<key>Entitlements</key><dict>" + std::string(entitlementsBody) + "</dict>";
  }
  return plistDocument("<dict>" + body + "</dict>");
}

void setOwnerAndMode(const std::string& path, uid_t owner, mode_t mode) {
  ASSERT_EQ(::chown(path.c_str(), owner, owner), 0) << path;
  ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path;
}

// A scratch root with two registered client binaries, "alpha" (entitled to
// "allowed") and "beta" (entitled to "none"), each its own copy of /bin/true.
class Registry {
 public:
  Registry() {
    fs::create_directories(directory());
    setOwnerAndMode(directory(), 0, 0755);
    writeEntry("alpha.plist", entry("com.example.alpha", "Executable", client("alpha"),
                                    "<key>com.zorvane.private.Kestrel.allowed</key><true/>"));
    writeEntry("beta.plist", entry("com.example.beta", "Executable", client("beta"),
                                   "<key>com.zorvane.private.Kestrel.none</key><true/>"));
  }

  std::string directory() const { return scratch.resolve("/etc/kestrel/signatures"); }
  std::string file(const std::string& name) const { return directory() + "/" + name; }

  // The path of a client binary as /proc/<pid>/exe would show it, installed
  // (root-owned, 0755) on first use.
  std::string client(const std::string& name) {
    const fs::path path = scratch.resolve("/usr/libexec/kestrel-clients/" + name);
    if (!fs::exists(path)) {
      fs::create_directories(path.parent_path());
      fs::copy_file("/bin/true", path);
      setOwnerAndMode(path, 0, 0755);
    }
    return fs::canonical(path).string();
  }

  // Writes a registry file in place (root-owned, 0644).
  void writeEntry(const std::string& name, const std::string& contents) const {
    {
      std::ofstream out(file(name), std::ios::binary | std::ios::trunc);
      out << contents;
    }
    setOwnerAndMode(file(name), 0, 0644);
  }

  // Replaces a registry file by a rename, as an operator's tools would.
  void replaceEntry(const std::string& name, const std::string& contents) const {
    writeEntry(name + ".new", contents);
    fs::rename(file(name + ".new"), file(name));
  }

  PeerCredentials peer(const std::optional<std::string>& executable,
                       const std::optional<std::string>& label = std::nullopt) const {
    PeerCredentials peer;
    peer.pid = 4242;
    peer.uid = 501;
    peer.gid = 501;
    peer.executablePath = executable;
    peer.securityLabel = label;
    return peer;
  }

  ScratchRoot scratch;
};

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

// Setup of a row: writes gamma.plist as a dictionary of `items` (plus the gamma client's
// path under `matchKey`, if any) and returns the gamma client as the peer.
std::function<PeerCredentials(Registry&)> gamma(std::string items, const char* matchKey) {
  return [items, matchKey](Registry& r) {
    const std::string match = matchKey ? stringItem(matchKey, r.client("gamma")) : "";
    r.writeEntry("gamma.plist", plistDocument("<dict>" + items + match + "</dict>"));
    return r.peer(r.client("gamma"));
  };
}

TEST(CodeSigningIdentityTest, IdentifiesPeersFromTheRegistry) {
  const PlistDictionary alphaEntitlements{{kAllowed, true}};
  struct Row {
    const char* name;
    // Changes the registry and returns the peer to identify.
    std::function<PeerCredentials(Registry&)> setup;
    const char* identifier;  // nullptr: none
    std::optional<PlistDictionary> entitlements;
    std::string errorContains;  // checked when there is no identifier
  };
  const Row rows[] = {
      {"executable selects its entry", [](Registry& r) { return r.peer(r.client("alpha")); },
       "com.example.alpha", alphaEntitlements, ""},
      {"each copy of the binary is its own identity",
       [](Registry& r) { return r.peer(r.client("beta")); }, "com.example.beta",
       PlistDictionary{{kNone, true}}, ""},
      {"the label selects the entry over the executable",
       [](Registry& r) {
         r.writeEntry("labelled.plist", entry("com.example.labelled", "Label", kLabel));
         return r.peer(r.client("alpha"), kLabel);
       },
       "com.example.labelled", PlistDictionary{}, ""},
      {"a labelled peer is not identified by its executable",
       [](Registry& r) { return r.peer(r.client("alpha"), "unregistered_t"); }, nullptr,
       std::nullopt, "no registered identity for unregistered_t"},
      {"registry file writable by group is ignored",
       [](Registry& r) {
         setOwnerAndMode(r.file("alpha.plist"), 0, 0664);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "alpha.plist is writable by group or others"},
      {"registry file not owned by root is ignored",
       [](Registry& r) {
         setOwnerAndMode(r.file("alpha.plist"), 501, 0644);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "alpha.plist is not owned by root (owner 501)"},
      {"registry file that is a symbolic link is ignored",
       [](Registry& r) {
         fs::rename(r.file("alpha.plist"), r.scratch.resolve("/etc/alpha.plist"));
         fs::create_symlink(r.scratch.resolve("/etc/alpha.plist"), r.file("alpha.plist"));
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "alpha.plist is a symbolic link"},
      {"executable writable by others is not trusted",
       [](Registry& r) {
         setOwnerAndMode(r.client("alpha"), 0, 0757);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "is writable by group or others"},
      {"executable not owned by root is not trusted",
       [](Registry& r) {
         setOwnerAndMode(r.client("alpha"), 501, 0755);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "is not owned by root (owner 501)"},
      {"registered executable that is gone",
       [](Registry& r) {
         const std::string path = r.client("alpha");
         fs::remove(path);
         return r.peer(path);
       },
       nullptr, std::nullopt, "cannot be examined"},
      {"peer with neither label nor executable", [](Registry& r) { return r.peer(std::nullopt); },
       nullptr, std::nullopt, "no security label and no executable known for pid 4242"},
      {"entry without entitlements gives the identifier alone",
       [](Registry& r) {
         r.writeEntry("gamma.plist",
                      entry("com.example.gamma", "Executable", r.client("gamma"), nullptr));
         return r.peer(r.client("gamma"));
       },
       "com.example.gamma", std::nullopt, ""},
      {"binary property list",
       [](Registry& r) {
         r.writeEntry("gamma.plist", binaryEntry("com.example.gamma", r.client("gamma")));
         return r.peer(r.client("gamma"));
       },
       "com.example.gamma", alphaEntitlements, ""},
      {"a malformed file does not spoil the others",
       [](Registry& r) {
         r.writeEntry("broken.plist", "<plist><dict><key>Sign");
         r.writeEntry("empty.plist", "");
         r.writeEntry("noise.plist", std::string("\0\1\2bplist00\xff", 12));
         return r.peer(r.client("alpha"));
       },
       "com.example.alpha", alphaEntitlements, ""},
      {"identifier that is not a string",
       gamma("<key>SigningIdentifier</key><integer>7</integer>", "Executable"), nullptr,
       std::nullopt, "gamma.plist has no \"SigningIdentifier\" string"},
      {"entitlements that are not a dictionary",
       gamma(stringItem("SigningIdentifier", "g") + "<key>Entitlements</key><array/>",
             "Executable"),
       nullptr, std::nullopt, "gamma.plist has an \"Entitlements\" value that is not"},
      {"entry with both a label and an executable",
       gamma(stringItem("SigningIdentifier", "g") + stringItem("Label", kLabel), "Executable"),
       nullptr, std::nullopt, "gamma.plist must have exactly one of"},
      {"label that is not a string",
       gamma(stringItem("SigningIdentifier", "g") + "<key>Label</key><true/>", nullptr), nullptr,
       std::nullopt, "gamma.plist has a \"Label\" that is not"},
      {"executable that is not a normalized absolute path",
       [](Registry& r) {
         r.writeEntry("gamma.plist",
                      entry("com.example.gamma", "Executable", "usr/libexec/gamma", nullptr));
         r.writeEntry("delta.plist",
                      entry("com.example.delta", "Executable", "/usr//libexec/delta", nullptr));
         return r.peer("usr/libexec/gamma");
       },
       nullptr, std::nullopt, "gamma.plist has an \"Executable\" that is not"},
      {"root that is not a dictionary",
       [](Registry& r) {
         r.writeEntry("gamma.plist", plistDocument("<array><string>x</string></array>"));
         return r.peer(r.client("gamma"));
       },
       nullptr, std::nullopt, "gamma.plist is not a dictionary"},
      {"executable registered twice is ambiguous",
       [](Registry& r) {
         r.writeEntry("gamma.plist", entry("com.example.beta", "Executable", r.client("beta")));
         return r.peer(r.client("beta"));
       },
       nullptr, std::nullopt, "is registered more than once: beta.plist gamma.plist"},
      {"directory writable by group trusts nothing",
       [](Registry& r) {
         setOwnerAndMode(r.directory(), 0, 0775);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "is not trusted: it is writable by group or others"},
      {"directory not owned by root trusts nothing",
       [](Registry& r) {
         setOwnerAndMode(r.directory(), 501, 0755);
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "is not trusted: it is not owned by root (owner 501)"},
      {"no registry directory",
       [](Registry& r) {
         fs::remove_all(r.directory());
         return r.peer(r.client("alpha"));
       },
       nullptr, std::nullopt, "no registered identity for "},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    Registry registry;
    const PeerCredentials peer = row.setup(registry);
    const CodeSigningIdentityResult result =
        LinuxCodeSigningIdentity(registry.scratch.root()).identify(peer);
    if (row.identifier != nullptr) {
      EXPECT_EQ(result.signingIdentifier, std::optional<std::string>(row.identifier));
      EXPECT_EQ(result.entitlements, row.entitlements);
      EXPECT_EQ(result.error, "");
    } else {
      EXPECT_EQ(result.signingIdentifier, std::nullopt);
      EXPECT_EQ(result.entitlements, std::nullopt);
      EXPECT_NE(result.error.find(row.errorContains), std::string::npos) << result.error;
    }
  }
}

TEST(CodeSigningIdentityTest, ChangesToTheRegistryAreSeenByTheNextLookup) {
  Registry registry;
  LinuxCodeSigningIdentity identity(registry.scratch.root());
  const PeerCredentials alpha = registry.peer(registry.client("alpha"));
  const PeerCredentials gamma = registry.peer(registry.client("gamma"));
  const auto identifierOf = [&](const PeerCredentials& peer) {
    return identity.identify(peer).signingIdentifier.value_or("(none)");
  };
  ASSERT_EQ(identifierOf(alpha), "com.example.alpha");

  struct Step {
    const char* name;
    std::function<void()> change;
    const PeerCredentials& peer;
    const char* identifier;
  };
  const Step steps[] = {
      {"file replaced by a rename",
       [&] {
         registry.replaceEntry("alpha.plist", entry("com.example.renamed", "Executable",
                                                    alpha.executablePath.value()));
       },
       alpha, "com.example.renamed"},
      {"file rewritten in place",
       [&] {
         registry.writeEntry("alpha.plist", entry("com.example.rewritten.in.place", "Executable",
                                                  alpha.executablePath.value()));
       },
       alpha, "com.example.rewritten.in.place"},
      {"file made group-writable", [&] { setOwnerAndMode(registry.file("alpha.plist"), 0, 0664); },
       alpha, "(none)"},
      {"file made safe again", [&] { setOwnerAndMode(registry.file("alpha.plist"), 0, 0644); },
       alpha, "com.example.rewritten.in.place"},
      {"file added",
       [&] {
         registry.writeEntry(
             "gamma.plist", entry("com.example.gamma", "Executable", gamma.executablePath.value()));
       },
       gamma, "com.example.gamma"},
      {"file removed", [&] { fs::remove(registry.file("alpha.plist")); }, alpha, "(none)"},
      {"directory made writable by others", [&] { setOwnerAndMode(registry.directory(), 0, 0777); },
       gamma, "(none)"},
      {"directory made safe again", [&] { setOwnerAndMode(registry.directory(), 0, 0755); }, gamma,
       "com.example.gamma"},
      // Changes on the way to the directory, which a watch of the directory
      // alone would not see.
      {"directory replaced by another one",
       [&] {
         const fs::path parent = fs::path(registry.directory()).parent_path();
         fs::rename(registry.directory(), parent / "signatures.old");
         fs::create_directory(registry.directory());
         setOwnerAndMode(registry.directory(), 0, 0755);
         registry.writeEntry("gamma.plist", entry("com.example.gamma.new", "Executable",
                                                  gamma.executablePath.value()));
       },
       gamma, "com.example.gamma.new"},
      {"the directory above it renamed away",
       [&] {
         const fs::path kestrel = fs::path(registry.directory()).parent_path();
         fs::rename(kestrel, kestrel.parent_path() / "kestrel.away");
       },
       gamma, "(none)"},
      {"the directory above it back again",
       [&] {
         const fs::path kestrel = fs::path(registry.directory()).parent_path();
         fs::rename(kestrel.parent_path() / "kestrel.away", kestrel);
       },
       gamma, "com.example.gamma.new"},
  };
  for (const Step& step : steps) {
    SCOPED_TRACE(step.name);
    step.change();
    EXPECT_EQ(identifierOf(step.peer), step.identifier);
  }
}

TEST(CodeSigningIdentityConcurrencyTest, LookupsWhileTheRegistryChanges) {
  Registry registry;
  LinuxCodeSigningIdentity identity(registry.scratch.root());
  const PeerCredentials alpha = registry.peer(registry.client("alpha"));
  const std::string path = alpha.executablePath.value();
  std::atomic<bool> done = false;
  std::atomic<int> unexpected = 0;
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&] {
      while (!done) {
        const CodeSigningIdentityResult result = identity.identify(alpha);
        const std::string id = result.signingIdentifier.value_or("");
        if (id != "com.example.alpha" && id != "com.example.other") ++unexpected;
      }
    });
  }
  for (int i = 0; i < 100; ++i) {
    registry.replaceEntry(
        "alpha.plist",
        entry(i % 2 == 0 ? "com.example.other" : "com.example.alpha", "Executable", path));
  }
  done = true;
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(unexpected, 0);
  EXPECT_EQ(identity.identify(alpha).signingIdentifier, "com.example.alpha");
}

// A damaged file (here a binary list whose string holds a NUL byte, which
// libplist itself asserts on) is refused like any unreadable one; the other
// entries still identify their peers.
TEST(CodeSigningIdentityTest, DamagedRegistryFileIsRefusedNotFollowed) {
  Registry registry;
  std::ifstream in(
      std::string(KESTREL_SOURCE_DIR) + "/fuzz/corpus/fuzz_signing_registry/string_with_nul.bplist",
      std::ios::binary);
  ASSERT_TRUE(in);
  registry.writeEntry("damaged.plist", std::string(std::istreambuf_iterator<char>(in), {}));
  const CodeSigningIdentityResult alpha = LinuxCodeSigningIdentity(registry.scratch.root())
                                              .identify(registry.peer(registry.client("alpha")));
  EXPECT_EQ(alpha.signingIdentifier, "com.example.alpha");
}

// The binary a peer ran, as it was when it connected, is what must be
// trusted, not what lies at its path by the time it asks: a writable binary
// swapped for a safe one after connecting does not pass.
TEST(CodeSigningIdentityTest, TheBinaryOpenedAtConnectIsTheOneExamined) {
  Registry registry;
  const std::string path = registry.client("alpha");
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
