#include "support/registered_clients.h"

#include <filesystem>

#include "platform/linux/named_semaphores_linux.h"

namespace kestrel::testing {

namespace fs = std::filesystem;

std::string registerProgram(const ScratchRoot& scratch, const std::string& name,
                            const std::string& identifier, const std::string& entitlements,
                            const std::string& program) {
  for (const char* directory : {"/etc/kestrel", "/etc/kestrel/signatures", "/bin"}) {
    fs::create_directories(scratch.resolve(directory));
    fs::permissions(scratch.resolve(directory), fs::perms(0755));
  }
  const std::string binary = scratch.resolve("/bin/" + name);
  fs::copy_file(program, binary, fs::copy_options::overwrite_existing);
  fs::permissions(binary, fs::perms(0755));
  const std::string plist = "/etc/kestrel/signatures/" + name + ".plist";
  const std::string body = "<key>SigningIdentifier</key><string>" + identifier +
                           "</string><key>Executable</key><string>" + binary +
                           "</string><key>Entitlements</key><dict>" + entitlements + "</dict>";
  scratch.writeFile(
      plist, "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>" + body +
                 "</dict></plist>\n");
  fs::permissions(scratch.resolve(plist), fs::perms(0644));
  return binary;
}

RegisteredClientsTest::RegisteredClientsTest() {
  registerClient("allowed-client", "com.example.installer",
                 "<key>com.zorvane.private.Kestrel.allowed</key><true/>");
  registerClient("plain-client", "com.example.app", "");
}

RegisteredClientsTest::~RegisteredClientsTest() {
  platform::LinuxNamedSemaphores(scratch.root()).remove("kestreld.fb_check");
}

void RegisteredClientsTest::registerClient(const std::string& name, const std::string& identifier,
                                           const std::string& entitlements) {
  registerProgram(scratch, name, identifier, entitlements, KESTRELCTL_BINARY);
}

ProcessResult RegisteredClientsTest::call(const std::string& client,
                                          std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), {"--root", scratch.path(), "call"});
  return runProcess(scratch.resolve("/bin/" + client), arguments);
}

ProcessResult RegisteredClientsTest::ctl(const std::string& client,
                                         std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), {"--root", scratch.path()});
  return runProcess(scratch.resolve("/bin/" + client), arguments);
}

std::string RegisteredClientsTest::log() const {
  return scratch.readFile("/private/var/root/Library/Logs/Kestrel/kestreld.log");
}

}  // namespace kestrel::testing
