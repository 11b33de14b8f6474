// A scratch root prepared for the real daemon: a registry of signatures with
// two copies of kestrelctl, "allowed-client" (entitlement "allowed") and
// "plain-client" (an empty Entitlements dictionary: no entitlements at all),
// and a way to call the daemon as either. The root's first-boot mark goes with it.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "support/daemon_process.h"
#include "support/scratch_root.h"

namespace kestrel::testing {

// Copies the program to /bin/<name> beneath the root and registers the copy
// under the identifier, with the entitlements given as the inside of a
// property-list <dict>; gives the copy's path.
std::string registerProgram(const ScratchRoot& scratch, const std::string& name,
                            const std::string& identifier, const std::string& entitlements,
                            const std::string& program);

class RegisteredClientsTest : public ::testing::Test {
 protected:
  RegisteredClientsTest();
  ~RegisteredClientsTest() override;

  // A copy of kestrelctl that the registry knows under the identifier, with
  // the entitlements given as the inside of a property-list <dict>.
  void registerClient(const std::string& name, const std::string& identifier,
                      const std::string& entitlements);
  // kestrelctl --root <root> call <arguments...>, run as the named client.
  ProcessResult call(const std::string& client, std::vector<std::string> arguments);
  // kestrelctl --root <root> <arguments...>, run as the named client.
  ProcessResult ctl(const std::string& client, std::vector<std::string> arguments);
  std::string log() const;

  ScratchRoot scratch;
};

}  // namespace kestrel::testing
