// The platform services the daemon's logic reaches, installed once per process:
// the Linux implementations by the daemon's entry point, fakes by tests.
#pragma once

#include <memory>

#include "platform/accounts.h"
#include "platform/application_lifecycle.h"
#include "platform/code_signing_identity.h"
#include "platform/device_info.h"
#include "platform/extended_acl.h"
#include "platform/keep_alive.h"
#include "platform/key_bag.h"
#include "platform/logging.h"
#include "platform/message_ipc.h"
#include "platform/named_semaphores.h"
#include "platform/root.h"
#include "platform/sandbox.h"
#include "platform/upcall_channel.h"

namespace kestrel::platform {

struct Services {
  FilesystemRoot root;
  std::shared_ptr<Accounts> accounts;
  std::shared_ptr<Logging> logging;
  std::shared_ptr<DeviceInfo> deviceInfo;
  std::shared_ptr<KeepAlive> keepAlive;
  std::shared_ptr<NamedSemaphores> semaphores;
  std::shared_ptr<KeyBag> keyBag;
  std::shared_ptr<UpcallChannel> upcall;
  std::shared_ptr<MessageIPC> messageIPC;
  std::shared_ptr<Sandbox> sandbox;
  std::shared_ptr<CodeSigningIdentity> codeSigningIdentity;
  std::shared_ptr<ExtendedACL> extendedACL;
  std::shared_ptr<ApplicationLifecycle> applicationLifecycle;
};

// The installed services. Installing is done before any other thread uses them.
const Services& services();
void installServices(Services services);

// The Linux implementations beneath the given root.
Services makeLinuxServices(const FilesystemRoot& root);

}  // namespace kestrel::platform
