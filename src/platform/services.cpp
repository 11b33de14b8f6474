#include "platform/services.h"

namespace kestrel::platform {

namespace {
Services& installed() {
  static Services s;
  return s;
}
}  // namespace

const Services& services() { return installed(); }

void installServices(Services services) { installed() = std::move(services); }

}  // namespace kestrel::platform
