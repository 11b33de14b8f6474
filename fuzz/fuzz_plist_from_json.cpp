// kestrelctl's JSON-to-property-list conversion on arbitrary text. What it
// accepts travels in a request, prints as JSON the way a reply does, and reads
// back as the same value.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "kestrelctl/reply_json.h"
#include "kestrelctl/request_items.h"
#include "support/fuzz_environment.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace kestrel;
  using namespace kestrel::fuzz;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  std::string error;
  const auto value = kestrelctl::plistFromJson(text, &error);
  if (!value) {
    KESTREL_FUZZ_CHECK(!error.empty(), "a refusal without a message");
    return 0;
  }
  platform::MessageDictionary request;
  if (!request.setPlist("Value", *value)) {
    KESTREL_FUZZ_CHECK(plistContainerDepth(*value) >= platform::kMaxMessageDepth,
                       "a shallow value did not travel");
    return 0;
  }
  const std::string printed = kestrelctl::replyToJson(request).dump();
  const auto reread = kestrelctl::plistFromJson(printed, &error);
  KESTREL_FUZZ_CHECK(reread.has_value(), "printed JSON does not read back: " + printed);
  const PlistValue* back = reread->find("Value");
  KESTREL_FUZZ_CHECK(back != nullptr && plistEquivalent(*value, *back),
                     value->description() + " printed as " + printed);
  return 0;
}
