#include "platform/services.h"

#include "platform/never_destroyed.h"

namespace kestrel::platform {

namespace {
Services& installed() {
  static NeverDestroyed<Services> s([](void* where) { return new (where) Services(); });
  return *s;
}
}  // namespace

const Services& services() {
  return installed();
}

void installServices(Services services) {
  installed() = std::move(services);
}

}  // namespace kestrel::platform
