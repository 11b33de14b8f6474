// One file of the code-signing identity registry with arbitrary contents,
// read by a fresh registry per input and asked for the peers it names. The
// registry reads its files with libplist directly; what the daemon's own
// property-list parser reads from the same bytes must identify the same way.
#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "platform/linux/code_signing_identity_linux.h"
#include "platform/plist_serialization.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;

const std::string& registryFile() {
  static const std::string path = [] {
    const std::string directory = environment().resolve("/etc/kestrel/signatures");
    makeDirectoriesOrDie(directory);
    // Trusted only when root owns it and no one else may write.
    ::chmod(environment().resolve("/etc/kestrel").c_str(), 0755);
    ::chmod(directory.c_str(), 0755);
    // Made once with the mode the registry trusts; rewriting it keeps the mode.
    const std::string file = directory + "/fuzzed.plist";
    writeFileOrDie(file, {});
    ::chmod(file.c_str(), 0644);
    return file;
  }();
  return path;
}

const std::string* stringMember(const PlistValue& dictionary, const char* key) {
  const PlistValue* value = dictionary.find(key);
  return value != nullptr ? value->string() : nullptr;
}

bool hasNul(const std::string& s) {
  return s.find('\0') != std::string::npos;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::span<const std::uint8_t> bytes(data, size);
  writeFileOrDie(registryFile(), bytes);

  platform::LinuxCodeSigningIdentity registry(environment());
  const auto parsed = platform::parsePropertyList(bytes, nullptr);

  platform::PeerCredentials byLabel;
  byLabel.pid = 1;
  byLabel.securityLabel = "fuzz_label_t";
  const std::string* label = parsed ? stringMember(*parsed, "Label") : nullptr;
  if (label != nullptr) byLabel.securityLabel = *label;
  const auto labelResult = registry.identify(byLabel);
  KESTREL_FUZZ_CHECK(labelResult.signingIdentifier.has_value() || !labelResult.error.empty(),
                     "no identifier and no reason");

  platform::PeerCredentials byExecutable;
  byExecutable.pid = 1;
  const std::string* executable = parsed ? stringMember(*parsed, "Executable") : nullptr;
  byExecutable.executablePath = executable != nullptr ? *executable : "/bin/sh";
  (void)registry.identify(byExecutable);

  // A well-formed entry with a label identifies its peer. (Text with a NUL is
  // left out: the registry reads strings as C strings.)
  if (!parsed || !parsed->isDictionary() || label == nullptr || label->empty() || hasNul(*label)) {
    return 0;
  }
  const std::string* identifier = stringMember(*parsed, "SigningIdentifier");
  const PlistValue* entitlements = parsed->find("Entitlements");
  if (identifier == nullptr || identifier->empty() || hasNul(*identifier) ||
      parsed->find("Executable") != nullptr ||
      (entitlements != nullptr && !entitlements->isDictionary())) {
    return 0;
  }
  KESTREL_FUZZ_CHECK(labelResult.signingIdentifier == *identifier,
                     "a valid entry was not found: " + labelResult.error);
  KESTREL_FUZZ_CHECK(labelResult.entitlements.has_value() == (entitlements != nullptr),
                     "entitlements lost");
  return 0;
}
