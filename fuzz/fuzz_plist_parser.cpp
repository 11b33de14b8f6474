// The property-list parser on arbitrary bytes. What it accepts must serialise
// back (unless a string is not UTF-8 or holds a NUL), parse again to the same
// value, and travel as a message value and back with only its dates turned
// into reals.
#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "platform/message_ipc.h"
#include "platform/plist_serialization.h"
#include "support/fuzz_environment.h"

namespace {

using kestrel::PlistValue;
using namespace kestrel::fuzz;
namespace platform = kestrel::platform;

void checkSerialization(const PlistValue& value) {
  std::string error;
  const auto bytes = platform::serializeBinaryPropertyList(value, &error);
  if (!bytes) {
    KESTREL_FUZZ_CHECK(!plistIsPlainAscii(value), "a plain value did not serialise: " + error);
    KESTREL_FUZZ_CHECK(error == "property list string is not UTF-8 or holds a NUL byte",
                       "unexpected serialisation failure: " + error);
    return;
  }
  std::string reparseError;
  const auto reparsed = platform::parsePropertyList(*bytes, &reparseError);
  KESTREL_FUZZ_CHECK(reparsed.has_value(), "own output does not parse: " + reparseError);
  KESTREL_FUZZ_CHECK(
      plistEquivalent(value, *reparsed),
      "binary round trip changed " + value.description() + " into " + reparsed->description());
}

void checkMessageConversion(const PlistValue& value) {
  const auto message = platform::plistToMessageValue(value);
  if (!message) {
    KESTREL_FUZZ_CHECK(plistContainerDepth(value) > platform::kMaxMessageDepth,
                       "a shallow value did not convert: " + value.description());
    return;
  }
  const auto back = platform::messageValueToPlist(*message);
  KESTREL_FUZZ_CHECK(back.has_value(), "a converted value does not convert back");
  KESTREL_FUZZ_CHECK(
      plistEquivalent(value, *back, /*datesAsReals=*/true),
      "message round trip changed " + value.description() + " into " + back->description());
  const auto messageAgain = platform::plistToMessageValue(*back);
  KESTREL_FUZZ_CHECK(messageAgain && messageEquivalent(*message, *messageAgain),
                     "message -> plist -> message is not the identity");
  // The description renders any value without failing.
  (void)message->description();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string error;
  const auto value = platform::parsePropertyList(std::span<const std::uint8_t>(data, size), &error);
  if (!value) {
    KESTREL_FUZZ_CHECK(!error.empty(), "a parse failure without a reason");
    return 0;
  }
  (void)value->description();
  checkSerialization(*value);
  checkMessageConversion(*value);
  return 0;
}
