#include "support/fake_services.h"

#include "daemon/log.h"
#include "daemon/request_dispatch.h"

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
      extendedACL(std::make_shared<platform::FakeExtendedACL>(accounts)),
      applicationLifecycle(std::make_shared<platform::FakeApplicationLifecycle>()) {
  services = {scratch.root(),
              accounts,
              logging,
              deviceInfo,
              keepAlive,
              semaphores,
              keyBag,
              upcall,
              messageIPC,
              sandbox,
              codeSigningIdentity,
              extendedACL,
              applicationLifecycle};
  install();
}

FakeServices::~FakeServices() {
  Log::close();
  platform::installServices(platform::Services{});
}

void FakeServices::install() {
  platform::installServices(services);
}

std::shared_ptr<platform::FakeMessageConnection> FakeServices::connectAllowedClient(
    const std::string& identifier) {
  constexpr pid_t kPid = 4242;
  platform::CodeSigningIdentityResult identity;
  identity.signingIdentifier = identifier;
  identity.entitlements = PlistDictionary{{kKSTEntitlementAllowed, true}};
  codeSigningIdentity->setIdentityForPid(kPid, identity);
  platform::PeerCredentials peer;
  peer.pid = kPid;
  peer.uid = 0;
  return messageIPC->connect(peer);
}

std::size_t FakeServices::countLogged(std::string_view text, Match match,
                                      std::string_view tag) const {
  std::size_t count = 0;
  for (const auto& line : logging->lines()) {
    if (!tag.empty() && line.tag != tag) continue;
    const std::string_view m = line.message;
    count += match == Match::Exact      ? m == text
             : match == Match::Contains ? m.find(text) != std::string_view::npos
             : match == Match::Prefix   ? m.starts_with(text)
                                        : m.ends_with(text);
  }
  return count;
}

}  // namespace kestrel::testing
