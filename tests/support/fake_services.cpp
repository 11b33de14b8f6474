#include "support/fake_services.h"

#include "daemon/log.h"

namespace kestrel::testing {

FakeServices::FakeServices()
    : accounts(std::make_shared<platform::FakeAccounts>(scratch.root())),
      logging(std::make_shared<platform::FakeLogging>()),
      deviceInfo(std::make_shared<platform::FakeDeviceInfo>()),
      keepAlive(std::make_shared<platform::FakeKeepAlive>()),
      semaphores(std::make_shared<platform::FakeNamedSemaphores>()),
      keyBag(std::make_shared<platform::FakeKeyBag>()),
      upcall(std::make_shared<platform::FakeUpcallChannel>()),
      messageIPC(std::make_shared<platform::FakeMessageIPC>()),
      sandbox(std::make_shared<platform::FakeSandbox>()),
      codeSigningIdentity(std::make_shared<platform::FakeCodeSigningIdentity>()),
      extendedACL(std::make_shared<platform::FakeExtendedACL>(accounts)) {
  services.root = scratch.root();
  services.accounts = accounts;
  services.logging = logging;
  services.deviceInfo = deviceInfo;
  services.keepAlive = keepAlive;
  services.semaphores = semaphores;
  services.keyBag = keyBag;
  services.upcall = upcall;
  services.messageIPC = messageIPC;
  services.sandbox = sandbox;
  services.codeSigningIdentity = codeSigningIdentity;
  services.extendedACL = extendedACL;
  install();
}

FakeServices::~FakeServices() {
  Log::close();
  platform::installServices(platform::Services{});
}

void FakeServices::install() { platform::installServices(services); }

}  // namespace kestrel::testing
