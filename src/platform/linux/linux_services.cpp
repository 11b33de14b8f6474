// The Linux implementations of every platform service, beneath one root.
#include <memory>

#include "platform/linux/accounts_linux.h"
#include "platform/linux/application_lifecycle_linux.h"
#include "platform/linux/code_signing_identity_linux.h"
#include "platform/linux/dbus_listener.h"
#include "platform/linux/device_info_linux.h"
#include "platform/linux/extended_acl_linux.h"
#include "platform/linux/keep_alive_linux.h"
#include "platform/linux/key_bag_linux.h"
#include "platform/linux/logging_linux.h"
#include "platform/linux/named_semaphores_linux.h"
#include "platform/linux/sandbox_linux.h"
#include "platform/linux/upcall_channel_linux.h"
#include "platform/services.h"

namespace kestrel::platform {

Services makeLinuxServices(const FilesystemRoot& root) {
  Services services;
  services.root = root;
  services.accounts = std::make_shared<LinuxAccounts>(root);
  services.logging = makeLinuxLogging(root);
  services.deviceInfo = std::make_shared<LinuxDeviceInfo>(root);
  services.keepAlive = std::make_shared<LinuxKeepAlive>();
  services.semaphores = std::make_shared<LinuxNamedSemaphores>(root);
  services.keyBag = std::make_shared<LinuxKeyBag>(root);
  services.upcall = makeLinuxUpcallChannel(root);
  services.messageIPC = makeLinuxMessageIPC(root);
  services.sandbox = std::make_shared<LinuxSandbox>();
  services.codeSigningIdentity = std::make_shared<LinuxCodeSigningIdentity>(root);
  services.extendedACL = std::make_shared<LinuxExtendedACL>(services.accounts);
  services.applicationLifecycle =
      std::make_shared<LinuxApplicationLifecycle>(services.codeSigningIdentity);
  return services;
}

}  // namespace kestrel::platform
