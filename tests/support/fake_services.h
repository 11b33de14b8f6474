// A scratch root with every platform service faked and installed for the
// test's process; the log is closed and the services removed again at the end.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>

#include "platform/fake/fake_application_lifecycle.h"
#include "platform/fake/fake_code_signing_identity.h"
#include "platform/fake/fake_extended_acl.h"
#include "platform/fake/fake_logging.h"
#include "platform/fake/fake_message_ipc.h"
#include "platform/fake/fake_platform.h"
#include "platform/fake/fake_sandbox.h"
#include "platform/fake/fake_upcall_channel.h"
#include "platform/services.h"
#include "support/scratch_root.h"

namespace kestrel::testing {

// How a logged message is compared with the text looked for.
enum class Match { Exact, Contains, Prefix, Suffix };

class FakeServices {
 public:
  FakeServices();
  ~FakeServices();
  FakeServices(const FakeServices&) = delete;
  FakeServices& operator=(const FakeServices&) = delete;

  // Installs the current set again, after a test replaced one of them.
  void install();

  // A root peer (pid 4242) that signs as `identifier` with the "allowed"
  // entitlement, connected through the fake message IPC.
  std::shared_ptr<platform::FakeMessageConnection> connectAllowedClient(
      const std::string& identifier = "com.example.installer");

  // Log lines whose message matches the text (and whose tag is `tag`, unless empty).
  std::size_t countLogged(std::string_view text, Match match = Match::Exact,
                          std::string_view tag = {}) const;
  bool logged(std::string_view text, Match match = Match::Contains,
              std::string_view tag = {}) const {
    return countLogged(text, match, tag) > 0;
  }

  ScratchRoot scratch;
  platform::Services services;
  std::shared_ptr<platform::FakeAccounts> accounts;
  std::shared_ptr<platform::FakeLogging> logging;
  std::shared_ptr<platform::FakeDeviceInfo> deviceInfo;
  std::shared_ptr<platform::FakeKeepAlive> keepAlive;
  std::shared_ptr<platform::FakeNamedSemaphores> semaphores;
  std::shared_ptr<platform::FakeKeyBag> keyBag;
  std::shared_ptr<platform::FakeUpcallChannel> upcall;
  std::shared_ptr<platform::FakeMessageIPC> messageIPC;
  std::shared_ptr<platform::FakeSandbox> sandbox;
  std::shared_ptr<platform::FakeCodeSigningIdentity> codeSigningIdentity;
  std::shared_ptr<platform::FakeExtendedACL> extendedACL;
  std::shared_ptr<platform::FakeApplicationLifecycle> applicationLifecycle;
};

}  // namespace kestrel::testing
