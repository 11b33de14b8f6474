// kestrel-run: starts a program inside its containers. It asks the daemon
// what the kernel's sandbox asks when a process starts (which containers does
// it have, made if missing), over the upcall socket, as root standing for the
// kernel; then it replaces itself with bubblewrap confining the program to
// what the answer names (sandbox_plan.h). Nothing is started when the answer
// is not a full one.
//
//   kestrel-run --identifier ID [--user UID] [--plugin] [--group G]...
//               [--system-group G]... [--system-container ID] [--network]
//               -- PROGRAM [ARGS]
//
// Exit status: PROGRAM's own; 2 for a usage error, 3 when the daemon cannot
// be reached, 4 when it answered without every container, 6 when bwrap
// cannot be started.
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <chrono>
#include <cstring>
#include <iostream>
#include <string>
#include <vector>

#include "daemon/daemon_state.h"
#include "kestrelctl/upcall_command.h"
#include "platform/linux/upcall_client_linux.h"
#include "platform/root.h"
#include "sandbox_plan.h"

namespace {

using namespace kestrel;

constexpr int kExitUsage = 2;
constexpr int kExitUnreachable = 3;
constexpr int kExitRefused = 4;
constexpr int kExitLaunch = 6;

int fail(int status, const std::string& message) {
  std::cerr << "kestrel-run: " << message << "\n";
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Start a program inside its containers, made on first use."};
  kestrelctl::UpcallRequestOptions request;
  std::string identifier;
  std::optional<std::uint32_t> user;
  std::string root;
  std::string socket;
  run::LaunchOptions launch;
  bool printOnly = false;
  std::uint64_t timeoutSeconds = 120;
  std::vector<std::string> program;
  app.add_option("--identifier", identifier, "The app's identifier (its signing identifier)")
      ->required();
  app.add_option("--user", user, "The user whose containers are meant (default: the daemon's)");
  app.add_flag("--plugin", request.plugin, "The program is a plug-in");
  app.add_option("--group", request.groups, "An app group whose container it shares (repeatable)");
  app.add_option("--system-group", request.systemGroups,
                 "A system group container it shares (repeatable)");
  app.add_option("--system-container", request.systemContainer, "Its system container");
  app.add_flag("--network", launch.network, "Keep the host's network");
  app.add_option("--root", root, "The daemon's root (default: $KESTREL_ROOT or /)");
  app.add_option("--socket", socket,
                 "The upcall socket (default: <root>/run/kestrel/com.zorvane.kestreld.upcall)");
  app.add_option("--bwrap", launch.bwrap, "The bubblewrap binary (default: bwrap from PATH)");
  app.add_option("--timeout", timeoutSeconds, "Seconds to wait for the daemon; 0 waits for ever");
  app.add_flag("--print-command", printOnly,
               "Print bwrap's command line, one argument a line, instead of starting it");
  app.footer(
      "Runs as root: the upcall socket answers root alone, which stands for the kernel.\n"
      "Exit status: the program's; 2 usage, 3 daemon unreachable, 4 containers refused,\n"
      "6 bwrap not started.");
  // The program is everything after the first "--", given to no parser.
  int ours = 1;
  while (ours < argc && std::strcmp(argv[ours], "--") != 0) ++ours;
  program.assign(argv + std::min(ours + 1, argc), argv + argc);
  try {
    app.parse(ours, argv);
    if (program.empty()) throw CLI::RequiredError("PROGRAM after --");
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? 0 : kExitUsage;
  }

  const platform::FilesystemRoot filesystemRoot =
      root.empty() ? platform::FilesystemRoot::fromEnvironment() : platform::FilesystemRoot(root);
  launch.root = filesystemRoot.path();
  if (socket.empty()) socket = platform::upcallSocketPath(filesystemRoot, kKSTUpcallServiceName);
  request.signingIdentifier = identifier;
  request.persona = user;

  std::vector<std::uint8_t> datagram;
  std::string error;
  if (!kestrelctl::buildUpcallRequest(request, &datagram, &error)) return fail(kExitUsage, error);
  std::optional<platform::UpcallClient> client = platform::UpcallClient::connect(socket, &error);
  if (!client) return fail(kExitUnreachable, "cannot reach " + socket + ": " + error);
  if (!client->send(datagram, &error)) {
    return fail(kExitUnreachable, "no answer from the daemon: " + error);
  }
  // While the daemon answers: the account of the user asked for, who owns the
  // containers (an account database that is not files can take a while).
  std::optional<run::AccountLookup> ahead;
  if (user) ahead = run::AccountLookup{*user, run::accountOf(*user)};
  const auto outcome = client->receive(std::chrono::seconds(timeoutSeconds));
  if (outcome.status != platform::UpcallClient::Status::Reply) {
    return fail(kExitUnreachable, "no answer from the daemon: " + outcome.message);
  }
  const auto reply = kestrelctl::decodeUpcallReply(outcome.reply, &error);
  if (!reply) return fail(kExitRefused, "a malformed reply: " + error);
  const auto plan = run::planFromReply(*reply, ahead ? &*ahead : nullptr, &error);
  if (!plan) return fail(kExitRefused, error + "; nothing started");

  const std::vector<std::string> command = run::bwrapCommand(*plan, launch, program);
  if (printOnly) {
    for (const std::string& argument : command) std::cout << argument << "\n";
    return 0;
  }
  std::vector<char*> arguments;
  for (const std::string& argument : command)
    arguments.push_back(const_cast<char*>(argument.c_str()));
  arguments.push_back(nullptr);
  ::execvp(arguments[0], arguments.data());
  return fail(kExitLaunch, launch.bwrap + ": " + std::strerror(errno));
}
