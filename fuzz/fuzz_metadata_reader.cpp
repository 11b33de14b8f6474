// A container's metadata file with arbitrary contents, read and checked as a
// lookup or a listing would. Where the container lies and which user reads it
// follow from the file itself (when it names a class and a persona) and from
// the input's size, so that both the accepting and the refusing paths are
// reached. A record that is accepted must survive being written back and read
// again.
#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <span>
#include <string>

#include "daemon/error_codes.h"
#include "daemon/errors.h"
#include "platform/plist_serialization.h"
#include "store/container_class.h"
#include "store/metadata.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;

// <root>/fuzz/Containers/<class path>/<name>
KSTFileURL containerURL(KSTContainerClass containerClass, const char* name) {
  const std::string directory = environment().resolve("/private/var/fuzz/Containers/") +
                                std::string(KSTContainerClassPath(containerClass));
  return KSTFileURL(directory, true).appending(name, true);
}

struct Placement {
  KSTContainerClass containerClass = 2;
  std::uint32_t forUser = kKSTFirstMobileUserId;
};

// Reads what the file claims, to put the container where the claim holds (or,
// on the other half of the inputs, where it does not).
Placement place(std::span<const std::uint8_t> bytes) {
  Placement placement;
  const bool honour = (bytes.size() & 1) == 0;
  placement.forUser = (bytes.size() & 2) != 0 ? kKSTInstallerUserId : kKSTFirstMobileUserId;
  const auto parsed = platform::parsePropertyList(bytes, nullptr);
  if (!parsed || !honour) return placement;
  if (const PlistValue* c = parsed->find(kKSTMetadataContentClassKey)) {
    if (auto value = c->unsignedInteger(); value && KSTIsValidContainerClass(*value)) {
      placement.containerClass = *value;
    }
  }
  if (const PlistValue* p = parsed->find(kKSTMetadataPersonaKey)) {
    if (auto value = p->unsignedInteger()) placement.forUser = static_cast<std::uint32_t>(*value);
  }
  return placement;
}

KSTMetadataRef read(const KSTFileURL& url, std::uint32_t forUser, bool checkClassPath) {
  KSTErrorRef error;
  KSTMetadataRef record =
      KSTMetadata::readAndValidateMetadataAtUrl(url, forUser, checkClassPath, &error);
  if (record) {
    KESTREL_FUZZ_CHECK(!error, "a record and an error");
    KESTREL_FUZZ_CHECK(KSTIsValidContainerClass(record->containerClass()), record->description());
    KESTREL_FUZZ_CHECK(record->uid() == forUser, record->description());
    KESTREL_FUZZ_CHECK(record->url() == url, record->description());
    (void)record->description();
  } else {
    KESTREL_FUZZ_CHECK(error != nullptr, "no record and no error");
    KESTREL_FUZZ_CHECK(
        error->code() == kKSTErrorMetadataReadFailed || error->code() == kKSTErrorInvalidMetadata,
        "unexpected code " + std::to_string(error->code()));
  }
  return record;
}

// Writes the record into a second container of its class and reads it back.
// It lies in its class's own directory, so the class path check passes too.
void checkWriteBack(const KSTMetadata& record) {
  const KSTFileURL copyURL = containerURL(record.containerClass(), "WrittenBack");
  // Made once per class, not for every record.
  static std::set<KSTContainerClass> made;
  if (made.insert(record.containerClass()).second) makeDirectoriesOrDie(copyURL.path());
  const KSTMetadataRef copy =
      KSTMetadata::initWithUserId(record.uid(), record.uuid(), record.containerClass(),
                                  record.identifier(), record.info(), copyURL);
  KSTErrorRef error;
  if (!copy->writeMetadataToDiskWithError(&error)) {
    // Only text the binary format cannot hold (not UTF-8, or a NUL) stops a write.
    KESTREL_FUZZ_CHECK(error && error->code() == kKSTErrorWriteFailed, record.description());
    return;
  }
  const KSTMetadataRef reread = read(copyURL, record.uid(), /*checkClassPath=*/true);
  KESTREL_FUZZ_CHECK(reread != nullptr,
                     "a written record does not read back: " + record.description());
  KESTREL_FUZZ_CHECK(reread->identifier() == record.identifier(), record.description());
  KESTREL_FUZZ_CHECK(reread->uuid() == record.uuid(), record.description());
  KESTREL_FUZZ_CHECK(reread->containerClass() == record.containerClass(), record.description());
  const auto infoBefore = record.info();
  const auto infoAfter = reread->info();
  KESTREL_FUZZ_CHECK(infoBefore.has_value() == infoAfter.has_value(), record.description());
  if (infoBefore) {
    KESTREL_FUZZ_CHECK(plistEquivalent(PlistValue(*infoBefore), PlistValue(*infoAfter)),
                       record.description());
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  environment();
  const std::span<const std::uint8_t> bytes(data, size);
  const Placement placement = place(bytes);
  const KSTFileURL url = containerURL(placement.containerClass, "Fuzzed");
  writeFileOrDie(KSTMetadata::metadataFileURL(url).path(), bytes);

  const KSTMetadataRef loose = read(url, placement.forUser, /*checkClassPath=*/false);
  const KSTMetadataRef strict = read(url, placement.forUser, /*checkClassPath=*/true);
  // The class-path check only ever refuses more.
  KESTREL_FUZZ_CHECK(!strict || loose, "accepted with the class path check only");
  if (strict) {
    KESTREL_FUZZ_CHECK(strict->identifier() == loose->identifier() &&
                           strict->uuid() == loose->uuid() &&
                           strict->containerClass() == loose->containerClass(),
                       "the two reads disagree");
  }
  if (loose) checkWriteBack(*loose);
  return 0;
}
