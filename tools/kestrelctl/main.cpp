// kestrelctl: sends one request to kestreld and prints its reply as JSON.
//
//   kestrelctl [--root R | --address unix:path=...] call <command> key=type:value ...
//
// Exit status: 0 when the reply's "ReplyError" is 1 (success); 1 when the
// daemon answered with another code; 2 for a usage error; 3 when the daemon
// cannot be reached; 4 when it closed the connection without a reply (the
// request was refused); 5 for a D-Bus error reply; 6 for a failure of the
// tool itself.
#include <CLI/CLI.hpp>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "client.h"
#include "platform/linux/dbus_listener.h"
#include "platform/root.h"
#include "reply_json.h"
#include "request_items.h"

namespace {

constexpr const char* kServiceName = "com.zorvane.kestreld";

enum ExitStatus {
  kExitSuccess = 0,
  kExitReplyError = 1,
  kExitUsage = 2,
  kExitUnreachable = 3,
  kExitRefused = 4,
  kExitDBusError = 5,
  kExitInternal = 6,
};

int runCall(const std::string& address, const std::string& command,
            const std::vector<std::string>& items, std::uint64_t timeoutSeconds) {
  using namespace kestrel;
  platform::MessageDictionary request;
  std::uint64_t index = 0;
  {
    std::string error;
    if (!kestrelctl::addRequestItem("Command=u64:" + command, &request, &error)) {
      std::cerr << "kestrelctl: the command must be a number: " << command << "\n";
      return kExitUsage;
    }
    index = request.uint64("Command");
  }
  for (const std::string& item : items) {
    std::string error;
    if (!kestrelctl::addRequestItem(item, &request, &error)) {
      std::cerr << "kestrelctl: " << error << "\n";
      return kExitUsage;
    }
  }
  request.setUint64("Command", index);  // an item may not override the command

  const kestrelctl::CallOutcome outcome =
      kestrelctl::callDaemon(address, kServiceName, request, timeoutSeconds);
  switch (outcome.kind) {
    case kestrelctl::CallOutcome::Kind::Unreachable:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitUnreachable;
    case kestrelctl::CallOutcome::Kind::Refused:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitRefused;
    case kestrelctl::CallOutcome::Kind::ErrorReply:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitDBusError;
    case kestrelctl::CallOutcome::Kind::Reply:
      break;
  }
  std::cout << kestrelctl::replyToJson(outcome.reply)
                   .dump(2, ' ', false, nlohmann::json::error_handler_t::replace)
            << "\n";
  const std::uint64_t code = outcome.reply.uint64("ReplyError");
  if (code == 1) return kExitSuccess;
  std::cerr << "kestrelctl: the request failed with error " << code << "\n";
  return kExitReplyError;
}

int run(int argc, char** argv) {
  CLI::App app{"Send a request to kestreld and print its reply as JSON."};
  app.footer(
      "Item types: u64, i64, bool, str, uuid, data (hex), plist (a JSON value).\n"
      "Example: kestrelctl call 0 ContainerClass=u64:2 UserID=u64:501 "
      "Identifier=str:com.example.app\n"
      "Exit status: 0 success (ReplyError 1), 1 other ReplyError, 2 usage, 3 unreachable,\n"
      "4 connection closed without a reply (refused), 5 D-Bus error reply, 6 internal failure.");
  app.require_subcommand(1);

  std::string root;
  std::string address;
  auto* rootOption =
      app.add_option("--root", root, "Filesystem root of the daemon (default: $KESTREL_ROOT or /)");
  app.add_option("--address", address,
                 "D-Bus address, e.g. unix:path=/run/kestrel/com.zorvane.kestreld")
      ->excludes(rootOption);

  std::string command;
  std::vector<std::string> items;
  std::uint64_t timeoutSeconds = 120;
  CLI::App* call = app.add_subcommand("call", "Send one request");
  call->add_option("command", command, "Command index (uint64)")->required();
  call->add_option("items", items, "Request keys: key=type:value");
  call->add_option("--timeout", timeoutSeconds, "Seconds to wait for the reply; 0 waits for ever")
      ->capture_default_str();

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kExitUsage;
  }

  if (address.empty()) {
    const kestrel::platform::FilesystemRoot filesystemRoot =
        root.empty() ? kestrel::platform::FilesystemRoot::fromEnvironment()
                     : kestrel::platform::FilesystemRoot(root);
    address =
        "unix:path=" + kestrel::platform::messageServiceSocketPath(filesystemRoot, kServiceName);
  }
  return runCall(address, command, items, timeoutSeconds);
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& e) {
    std::cerr << "kestrelctl: " << e.what() << "\n";
    return kExitInternal;
  }
}
