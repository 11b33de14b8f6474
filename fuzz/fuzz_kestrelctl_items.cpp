// kestrelctl's request items ("key=type:value") on arbitrary text: an item is
// either added under its key or refused with a message, never half-added.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "kestrelctl/request_items.h"
#include "support/fuzz_environment.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace kestrel;
  const std::string_view item(reinterpret_cast<const char*>(data), size);
  platform::MessageDictionary request;
  std::string error;
  if (kestrelctl::addRequestItem(item, &request, &error)) {
    KESTREL_FUZZ_CHECK(request.size() == 1, "an item added " + std::to_string(request.size()));
    KESTREL_FUZZ_CHECK(request.contains(item.substr(0, item.find('='))), "added under another key");
    (void)request.description();
  } else {
    KESTREL_FUZZ_CHECK(request.empty(), "a refused item changed the request");
    KESTREL_FUZZ_CHECK(!error.empty(), "a refusal without a message");
  }
  return 0;
}
