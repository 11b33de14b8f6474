#include "support/fuzz_environment.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <system_error>

#include "platform/fake/fake_code_signing_identity.h"
#include "platform/fake/fake_extended_acl.h"
#include "platform/fake/fake_message_ipc.h"
#include "platform/fake/fake_platform.h"
#include "platform/fake/fake_sandbox.h"
#include "platform/fake/fake_upcall_channel.h"
#include "platform/logging.h"
#include "platform/services.h"
#include "platform/unique_fd.h"

namespace kestrel::fuzz {

namespace {

namespace fs = std::filesystem;

// Formats every line (the formatter sees hostile text too) and keeps none.
class DiscardingLogHandle final : public platform::LogHandle {
 public:
  bool enableDiskLogging(const std::string&, std::size_t, std::size_t, int) override {
    return true;
  }
  void write(int, std::string_view, std::string_view) override {}
  void flush() override {}
};

class DiscardingLogging final : public platform::Logging {
 public:
  std::unique_ptr<platform::LogHandle> open(const std::string&, const std::string&) override {
    return std::make_unique<DiscardingLogHandle>();
  }
  void writeWithoutHandle(int, std::string_view, std::string_view) override {}
  void writeSystemLog(int, std::string_view) override {}
};

std::string& scratchPath() {
  static std::string path;
  return path;
}

void removeScratch() {
  if (scratchPath().empty()) return;
  std::error_code ec;
  fs::remove_all(scratchPath(), ec);
}

platform::FilesystemRoot makeEnvironment() {
  const char* parent = std::getenv("KESTREL_FUZZ_SCRATCH");
  std::string pattern = std::string(parent != nullptr && *parent != '\0' ? parent : "/dev/shm") +
                        "/kestrel-fuzz-XXXXXX";
  if (::mkdtemp(pattern.data()) == nullptr) fail("cannot make the scratch root", pattern);
  scratchPath() = pattern;
  std::atexit(removeScratch);
  ::chmod(pattern.c_str(), 0755);

  const platform::FilesystemRoot root(pattern);
  // The homes of the two mobile users, owned by them (the fuzzers run as root).
  for (const auto& [home, uid] :
       {std::pair{"/private/var/mobile", 501u}, std::pair{"/private/var/mobile2", 502u}}) {
    makeDirectoriesOrDie(root.resolve(home));
    if (::geteuid() == 0 && ::chown(root.resolve(home).c_str(), uid, uid) != 0) {
      fail("cannot chown a mobile home", root.resolve(home));
    }
  }

  platform::Services services;
  services.root = root;
  auto accounts = std::make_shared<platform::FakeAccounts>(root);
  services.accounts = accounts;
  services.logging = std::make_shared<DiscardingLogging>();
  services.deviceInfo = std::make_shared<platform::FakeDeviceInfo>();
  services.keepAlive = std::make_shared<platform::FakeKeepAlive>();
  services.semaphores = std::make_shared<platform::FakeNamedSemaphores>();
  services.keyBag = std::make_shared<platform::FakeKeyBag>();
  services.upcall = std::make_shared<platform::FakeUpcallChannel>();
  services.messageIPC = std::make_shared<platform::FakeMessageIPC>();
  services.sandbox = std::make_shared<platform::FakeSandbox>();
  services.codeSigningIdentity = std::make_shared<platform::FakeCodeSigningIdentity>();
  services.extendedACL = std::make_shared<platform::FakeExtendedACL>(accounts);
  platform::installServices(std::move(services));
  return root;
}

bool realsEquivalent(double a, double b) {
  return a == b || (std::isnan(a) && std::isnan(b));
}

}  // namespace

const platform::FilesystemRoot& environment() {
  static const platform::FilesystemRoot root = makeEnvironment();
  return root;
}

void makeDirectoriesOrDie(const std::string& path) {
  std::error_code ec;
  fs::create_directories(path, ec);
  if (ec) fail("cannot make a directory", path + ": " + ec.message());
}

void writeFileOrDie(const std::string& path, std::span<const std::uint8_t> bytes) {
  // Called for every input: one open, write and close when the directory is
  // already there (tmpfs, no sync), the directories only on the first call.
  constexpr int kFlags = O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC;
  platform::UniqueFd fd(::open(path.c_str(), kFlags, 0644));
  if (!fd && errno == ENOENT) {
    makeDirectoriesOrDie(fs::path(path).parent_path().string());
    fd.reset(::open(path.c_str(), kFlags, 0644));
  }
  if (!fd) fail("cannot open a file for writing", path + ": " + std::strerror(errno));
  std::size_t written = 0;
  while (written < bytes.size()) {
    const ssize_t n = ::write(fd.get(), bytes.data() + written, bytes.size() - written);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) fail("cannot write a file", path + ": " + std::strerror(errno));
    written += static_cast<std::size_t>(n);
  }
}

bool sampled(std::span<const std::uint8_t> input, unsigned oneIn) {
  std::uint64_t hash = 0xcbf29ce484222325ull;  // FNV-1a
  for (const std::uint8_t byte : input) hash = (hash ^ byte) * 0x100000001b3ull;
  return oneIn <= 1 || hash % oneIn == 0;
}

void fail(const char* what, const std::string& detail) {
  std::fprintf(stderr, "==kestrel-fuzz== %s\n%s\n", what, detail.c_str());
  std::fflush(stderr);
  std::abort();
}

bool plistEquivalent(const PlistValue& a, const PlistValue& b, bool datesAsReals) {
  if (datesAsReals) {
    const auto seconds = [](const PlistValue& v) -> std::optional<double> {
      if (const PlistDate* date = v.date()) return date->secondsSinceReferenceDate;
      if (v.type() == PlistValue::Type::Real) return v.real();
      return std::nullopt;
    };
    if (a.date() != nullptr || b.date() != nullptr) {
      const auto x = seconds(a);
      const auto y = seconds(b);
      return x && y && realsEquivalent(*x, *y);
    }
  }
  if (a.type() == PlistValue::Type::Real && b.type() == PlistValue::Type::Real) {
    return realsEquivalent(*a.real(), *b.real());
  }
  if (a.date() != nullptr && b.date() != nullptr) {
    return realsEquivalent(a.date()->secondsSinceReferenceDate,
                           b.date()->secondsSinceReferenceDate);
  }
  if (a.isArray() && b.isArray()) {
    const PlistArray& x = *a.array();
    const PlistArray& y = *b.array();
    if (x.size() != y.size()) return false;
    for (std::size_t i = 0; i < x.size(); ++i) {
      if (!plistEquivalent(x[i], y[i], datesAsReals)) return false;
    }
    return true;
  }
  if (a.isDictionary() && b.isDictionary()) {
    const PlistDictionary& x = *a.dictionary();
    const PlistDictionary& y = *b.dictionary();
    if (x.size() != y.size()) return false;
    for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
      if (i->first != j->first || !plistEquivalent(i->second, j->second, datesAsReals)) {
        return false;
      }
    }
    return true;
  }
  return a == b;
}

bool messageEquivalent(const platform::MessageValue& a, const platform::MessageValue& b) {
  using Type = platform::MessageValue::Type;
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case Type::Double:
      return realsEquivalent(*a.real(), *b.real());
    case Type::Array: {
      const platform::MessageArray& x = *a.array();
      const platform::MessageArray& y = *b.array();
      if (x.size() != y.size()) return false;
      for (std::size_t i = 0; i < x.size(); ++i) {
        if (!messageEquivalent(x[i], y[i])) return false;
      }
      return true;
    }
    case Type::Dictionary: {
      const auto& x = a.dictionary()->entries();
      const auto& y = b.dictionary()->entries();
      if (x.size() != y.size()) return false;
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
        if (i->first != j->first || !messageEquivalent(i->second, j->second)) return false;
      }
      return true;
    }
    default:
      return a == b;
  }
}

namespace {

bool isPlainAscii(std::string_view s) {
  for (const char c : s) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte == 0 || byte >= 0x80) return false;
  }
  return true;
}

}  // namespace

bool plistIsPlainAscii(const PlistValue& value) {
  if (const std::string* s = value.string()) return isPlainAscii(*s);
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& item : *array) {
      if (!plistIsPlainAscii(item)) return false;
    }
  }
  if (const PlistDictionary* dictionary = value.dictionary()) {
    for (const auto& [key, item] : *dictionary) {
      if (!isPlainAscii(key) || !plistIsPlainAscii(item)) return false;
    }
  }
  return true;
}

std::size_t plistContainerDepth(const PlistValue& value) {
  std::size_t deepest = 0;
  if (const PlistArray* array = value.array()) {
    for (const PlistValue& item : *array) deepest = std::max(deepest, plistContainerDepth(item));
    return deepest + 1;
  }
  if (const PlistDictionary* dictionary = value.dictionary()) {
    for (const auto& [key, item] : *dictionary) {
      deepest = std::max(deepest, plistContainerDepth(item));
    }
    return deepest + 1;
  }
  return 0;
}

}  // namespace kestrel::fuzz
