// kestrelctl: sends one request to kestreld and prints its reply.
//
//   kestrelctl [--root R | --address unix:path=...] [--json] [--timeout S] <subcommand> ...
//
// The named subcommands (create, lookup, list, sweep, ...) build the request
// from options and print the reply for people, or as JSON with --json;
// `call <command> key=type:value ...` sends any request and prints its reply
// as JSON.
//
// Exit status: 0 when the reply's "ReplyError" is 1 (success); 1 when the
// daemon answered with another code; 2 for a usage error; 3 when the daemon
// cannot be reached; 4 when it closed the connection without a reply (the
// request was refused); 5 for a D-Bus error reply; 6 for a failure of the
// tool itself.
#include <fcntl.h>
#include <CLI/CLI.hpp>
#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>
#include <vector>

#include "client.h"
#include "commands.h"
#include "daemon/daemon_state.h"
#include "fsck.h"
#include "human_output.h"
#include "platform/data_protection.h"
#include "platform/linux/dbus_listener.h"
#include "platform/linux/named_semaphores_linux.h"
#include "platform/linux/upcall_client_linux.h"
#include "platform/plist_serialization.h"
#include "platform/root.h"
#include "platform/services.h"
#include "platform/unique_fd.h"
#include "reply_json.h"
#include "request_items.h"
#include "upcall_command.h"

namespace {

using namespace kestrel;

enum ExitStatus {
  kExitSuccess = 0,
  kExitReplyError = 1,
  kExitUsage = 2,
  kExitUnreachable = 3,
  kExitRefused = 4,
  kExitDBusError = 5,
  kExitInternal = 6,
};

// The exit status of a call that got no reply, its reason printed; nothing
// when the daemon answered.
std::optional<int> callFailure(const kestrelctl::CallOutcome& outcome) {
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
  return std::nullopt;
}

void printJson(const platform::MessageDictionary& reply) {
  std::cout << kestrelctl::replyToJson(reply).dump(2, ' ', false,
                                                   nlohmann::json::error_handler_t::replace)
            << "\n";
}

int runCall(const std::string& address, const std::string& command,
            const std::vector<std::string>& items, std::uint64_t timeoutSeconds) {
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
      kestrelctl::callDaemon(address, kKSTServiceName, request, timeoutSeconds);
  if (auto status = callFailure(outcome)) return *status;
  printJson(outcome.reply);
  const std::uint64_t code = outcome.reply.uint64("ReplyError");
  if (code == 1) return kExitSuccess;
  std::cerr << "kestrelctl: the request failed with error " << code << "\n";
  return kExitReplyError;
}

// A named subcommand on the command line and what it was given, unparsed.
struct NamedArguments {
  CLI::App* app = nullptr;
  std::string containerClass;
  std::string user;
  std::string identifier;
  bool transient = false;
  std::string uuid;
  std::string key;
  std::string value;
  bool infoDictionary = false;
  std::string protectionClass;
  bool thirdParty = false;
  bool retryIfLocked = false;
  CLI::Option* classOption = nullptr;
  CLI::Option* userOption = nullptr;
  CLI::Option* identifierOption = nullptr;
  CLI::Option* uuidOption = nullptr;
  CLI::Option* keyOption = nullptr;
  CLI::Option* valueOption = nullptr;
  CLI::Option* protectionClassOption = nullptr;
};

void addNamedOptions(const kestrelctl::SubcommandInfo& info, NamedArguments* arguments) {
  CLI::App* sub = arguments->app;
  if (info.takes(kestrelctl::kOptionClass)) {
    arguments->classOption =
        sub->add_option("--class", arguments->containerClass,
                        "Container class: a number, or its name, e.g. Data/Application")
            ->required();
  }
  if (info.takes(kestrelctl::kOptionUser)) {
    arguments->userOption =
        sub->add_option("--user", arguments->user, "User id (1: the current mobile user)")
            ->required();
  }
  if (info.takes(kestrelctl::kOptionIdentifier)) {
    arguments->identifierOption = sub->add_option(
        "--identifier", arguments->identifier, "Container identifier (default: the caller's own)");
  }
  if (info.takes(kestrelctl::kOptionIdentifierRequired)) {
    arguments->identifierOption =
        sub->add_option("--identifier", arguments->identifier, "Identifier to look up")->required();
  }
  if (info.takes(kestrelctl::kOptionTransient)) {
    sub->add_flag("--transient", arguments->transient, "The transient variant of the class");
  }
  if (info.takes(kestrelctl::kOptionUUID)) {
    arguments->uuidOption = sub->add_option(
        "--uuid", arguments->uuid,
        "The container's UUID (default: the one of the container the other options name)");
  }
  if (info.takes(kestrelctl::kOptionKey)) {
    arguments->keyOption = sub->add_option("--key", arguments->key, "Info key")->required();
  }
  if (info.takes(kestrelctl::kOptionValue)) {
    arguments->valueOption =
        sub->add_option("--value", arguments->value, "The value, as JSON (e.g. 42, \"text\", {})")
            ->required();
  }
  if (info.takes(kestrelctl::kOptionInfoDictionary)) {
    sub->add_flag("--info", arguments->infoDictionary, "Show the info dictionary too");
  }
  if (info.takes(kestrelctl::kOptionProtectionClass)) {
    arguments->protectionClassOption =
        sub->add_option("--protection-class", arguments->protectionClass,
                        "The data-protection class to move to (a signed number)")
            ->required();
    sub->add_flag("--third-party", arguments->thirdParty,
                  "The app is a second- or third-party app (classes 0, 1 and 3 only)");
    sub->add_flag("--retry-if-locked", arguments->retryIfLocked,
                  "While the device is locked, wait for the next unlock (else: error 61)");
  }
}

// The container named by class, user and (own) identifier, looked up: its
// UUID and identifier go into the options. The exit status when that fails.
std::optional<int> lookUpContainer(const std::string& address, std::uint64_t timeoutSeconds,
                                   kestrelctl::RequestOptions* options) {
  const kestrelctl::SubcommandInfo& lookup =
      kestrelctl::subcommandInfo(kestrelctl::Subcommand::Lookup);
  platform::MessageDictionary request;
  std::string error;
  if (!kestrelctl::buildRequest(lookup, *options, &request, &error)) {
    std::cerr << "kestrelctl: " << error << "\n";
    return kExitUsage;
  }
  const kestrelctl::CallOutcome outcome =
      kestrelctl::callDaemon(address, kKSTServiceName, request, timeoutSeconds);
  if (auto status = callFailure(outcome)) return status;
  if (const std::uint64_t code = outcome.reply.uint64("ReplyError"); code != 1) {
    std::cerr << kestrelctl::failureMessage(lookup.name, code) << "\n";
    return kExitReplyError;
  }
  options->uuid = outcome.reply.uuid("ReplyUUID");
  options->identifier = outcome.reply.string("ReplyIdentifier");
  return std::nullopt;
}

int runNamed(const std::string& address, const kestrelctl::SubcommandInfo& info,
             const NamedArguments& arguments, bool json, std::uint64_t timeoutSeconds) {
  kestrelctl::RequestOptions options;
  std::string error;
  if (arguments.classOption && arguments.classOption->count() > 0) {
    options.containerClass = kestrelctl::parseContainerClass(arguments.containerClass, &error);
  }
  if (error.empty() && arguments.userOption && arguments.userOption->count() > 0) {
    options.userId = kestrelctl::parseUnsignedOption("--user", arguments.user, &error);
  }
  if (arguments.identifierOption && arguments.identifierOption->count() > 0) {
    options.identifier = arguments.identifier;
  }
  options.transient = arguments.transient;
  if (error.empty() && arguments.uuidOption && arguments.uuidOption->count() > 0) {
    options.uuid = platform::Uuid::parse(arguments.uuid);
    if (!options.uuid) error = "--uuid: \"" + arguments.uuid + "\" is not a UUID";
  }
  if (arguments.keyOption && arguments.keyOption->count() > 0) options.key = arguments.key;
  if (error.empty() && arguments.valueOption && arguments.valueOption->count() > 0) {
    std::string jsonError;
    options.value = kestrelctl::plistFromJson(arguments.value, &jsonError);
    if (!options.value) error = "--value: " + jsonError;
  }
  options.infoDictionary = arguments.infoDictionary;
  if (error.empty() && arguments.protectionClassOption &&
      arguments.protectionClassOption->count() > 0) {
    std::int64_t number = 0;
    const std::string& text = arguments.protectionClass;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (ec != std::errc() || end != text.data() + text.size() || text.empty()) {
      error = "--protection-class: \"" + text + "\" is not a signed 64-bit number";
    } else {
      options.protectionClass = number;
    }
  }
  options.thirdParty = arguments.thirdParty;
  options.retryIfLocked = arguments.retryIfLocked;
  if (error.empty() && info.takes(kestrelctl::kOptionUUID) && !options.uuid &&
      options.containerClass && options.userId) {
    if (auto status = lookUpContainer(address, timeoutSeconds, &options)) return *status;
  }

  platform::MessageDictionary request;
  if (!error.empty() || !kestrelctl::buildRequest(info, options, &request, &error)) {
    std::cerr << "kestrelctl: " << info.name << ": " << error << "\n";
    return kExitUsage;
  }

  const kestrelctl::CallOutcome outcome =
      kestrelctl::callDaemon(address, kKSTServiceName, request, timeoutSeconds);
  if (auto status = callFailure(outcome)) return *status;
  if (json) printJson(outcome.reply);
  const std::uint64_t code = outcome.reply.uint64("ReplyError");
  if (code != 1) {
    std::cerr << kestrelctl::failureMessage(info.name, code) << "\n";
    return kExitReplyError;
  }
  if (!json) std::cout << kestrelctl::renderReply(info.subcommand, outcome.reply);
  return kExitSuccess;
}

// Prints a property-list file (a metadata file, the code-signing mapping, a
// journal) as JSON. Works on the files alone; the daemon is not asked.
int runPlist(const std::string& file) {
  std::ifstream in(file, std::ios::binary);
  if (!in) {
    std::cerr << "kestrelctl: cannot open " << file << "\n";
    return kExitReplyError;
  }
  const std::vector<std::uint8_t> bytes((std::istreambuf_iterator<char>(in)),
                                        std::istreambuf_iterator<char>());
  std::string error;
  const std::optional<PlistValue> value = platform::parsePropertyList(bytes, &error);
  const PlistDictionary* dictionary = value ? value->dictionary() : nullptr;
  std::optional<platform::MessageDictionary> message;
  if (dictionary != nullptr) message = platform::MessageDictionary::fromPlist(*dictionary);
  if (!message) {
    std::cerr << "kestrelctl: " << file << " is not a property-list dictionary"
              << (error.empty() ? "" : ": " + error) << "\n";
    return kExitReplyError;
  }
  printJson(*message);
  return kExitSuccess;
}

// The sandbox's question over the upcall socket (only root, or a process
// allowed to override file permissions, can connect to it).
int runUpcall(const std::string& socketPath, const kestrelctl::UpcallRequestOptions& options,
              bool json, std::uint64_t timeoutSeconds) {
  std::vector<std::uint8_t> request;
  std::string error;
  if (!kestrelctl::buildUpcallRequest(options, &request, &error)) {
    std::cerr << "kestrelctl: upcall: " << error << "\n";
    return kExitUsage;
  }
  std::optional<platform::UpcallClient> client =
      platform::UpcallClient::connect(socketPath, &error);
  if (!client) {
    std::cerr << "kestrelctl: cannot reach the upcall socket " << error << "\n";
    return kExitUnreachable;
  }
  const platform::UpcallClient::Outcome outcome =
      client->call(request, std::chrono::seconds(timeoutSeconds));
  switch (outcome.status) {
    case platform::UpcallClient::Status::Reply:
      break;
    case platform::UpcallClient::Status::Closed:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitRefused;
    case platform::UpcallClient::Status::TimedOut:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitUnreachable;
    case platform::UpcallClient::Status::Failed:
      std::cerr << "kestrelctl: " << outcome.message << "\n";
      return kExitInternal;
  }
  const std::optional<kestrelctl::DecodedUpcallReply> reply =
      kestrelctl::decodeUpcallReply(outcome.reply, &error);
  if (!reply) {
    std::cerr << "kestrelctl: a malformed reply: " << error << "\n";
    return kExitInternal;
  }
  if (json) std::cout << kestrelctl::upcallReplyToJson(*reply).dump(2) << "\n";
  if (reply->returnCode != 0) {
    std::cerr << "kestrelctl: upcall failed: return code " << reply->returnCode << " ("
              << kestrelctl::upcallReturnCodeText(reply->returnCode) << ")\n";
    return kExitReplyError;
  }
  if (!json) std::cout << kestrelctl::renderUpcallReply(*reply);
  const auto status = std::find_if(reply->items.begin(), reply->items.end(), [](const auto& item) {
    return item.valueType == 0 && item.number;
  });
  return status != reply->items.end() && *status->number == 1 ? kExitSuccess : kExitReplyError;
}

// Prints the data-protection class of each item as the daemon reads it
// (symbolic links are not followed), "-" for an item without one. Works on
// the files alone; the daemon is not asked.
int runProtectionClasses(const std::vector<std::string>& paths, bool json) {
  nlohmann::json classes = nlohmann::json::object();
  int status = kExitSuccess;
  for (const std::string& path : paths) {
    const platform::UniqueFd fd(
        ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    std::optional<std::int32_t> protectionClass;
    const int error = fd ? platform::getProtectionClass(fd.get(), &protectionClass) : errno;
    if (error != 0) {
      std::cerr << "kestrelctl: " << path << ": " << std::strerror(error) << "\n";
      status = kExitReplyError;
      continue;
    }
    if (json) {
      classes[path] = protectionClass ? nlohmann::json(*protectionClass) : nlohmann::json();
    } else {
      std::cout << (protectionClass ? std::to_string(*protectionClass) : "-") << "  " << path
                << "\n";
    }
  }
  if (json) std::cout << classes.dump(2) << "\n";
  return status;
}

// Removes the mark that the boot-time work was done for this root, so that
// the daemon's next start does it again. Beneath a root other than /, the
// mark is a named semaphore in /dev/shm that outlives the root: removing a
// scratch root should remove it too. The daemon is not asked.
int runResetFirstBoot(const platform::FilesystemRoot& root) {
  platform::LinuxNamedSemaphores semaphores(root);
  const bool marked = semaphores.openExisting(kKSTFirstBootSemaphoreName);
  if (marked) semaphores.remove(kKSTFirstBootSemaphoreName);
  std::cout << (marked ? "removed " : "not present: ")
            << platform::scopedSemaphoreName(root, kKSTFirstBootSemaphoreName) << "\n";
  return kExitSuccess;
}

// The store's own messages go nowhere while fsck runs: it reports what it
// finds itself, with the reasons.
class SilentLogging : public platform::Logging {
 public:
  std::unique_ptr<platform::LogHandle> open(const std::string&, const std::string&) override {
    return nullptr;
  }
  void writeWithoutHandle(int, std::string_view, std::string_view) override {}
  void writeSystemLog(int, std::string_view) override {}
};

int runFsck(const platform::FilesystemRoot& root, const std::string& address, bool offline,
            std::uint64_t timeoutSeconds) {
  platform::Services services = platform::makeLinuxServices(root);
  services.logging = std::make_shared<SilentLogging>();
  platform::installServices(std::move(services));

  kestrelctl::ListContainers list;
  if (!offline) {
    platform::MessageDictionary probe;
    probe.setUint64("Command", 1);
    const kestrelctl::CallOutcome reached =
        kestrelctl::callDaemon(address, kKSTServiceName, probe, timeoutSeconds);
    if (reached.kind == kestrelctl::CallOutcome::Kind::Unreachable) {
      std::cerr << "kestrelctl: " << reached.message << " (fsck --offline checks the disk alone)\n";
      return kExitUnreachable;
    }
    list = [&](std::uint32_t user, KSTContainerClass containerClass, bool transient,
               std::string* error) -> std::optional<std::set<std::pair<std::string, std::string>>> {
      platform::MessageDictionary request;
      request.setUint64("Command", 1);
      request.setUint64("ContainerClass", containerClass);
      request.setUint64("UserID", user);
      request.setBoolean("Transient", transient);
      const kestrelctl::CallOutcome outcome =
          kestrelctl::callDaemon(address, kKSTServiceName, request, timeoutSeconds);
      if (outcome.kind != kestrelctl::CallOutcome::Kind::Reply) {
        *error = outcome.message;
        return std::nullopt;
      }
      if (const std::uint64_t code = outcome.reply.uint64("ReplyError"); code != 1) {
        *error = "error " + std::to_string(code);
        return std::nullopt;
      }
      std::set<std::pair<std::string, std::string>> pairs;
      const platform::MessageArray* ids = outcome.reply.array("ReplyIdsArray");
      const platform::MessageArray* uuids = outcome.reply.array("ReplyUUIDsArray");
      for (std::size_t i = 0; ids && uuids && i < ids->size() && i < uuids->size(); ++i) {
        const std::string* id = (*ids)[i].string();
        const std::optional<platform::Uuid> uuid = (*uuids)[i].uuid();
        if (id && uuid) pairs.emplace(*id, uuid->string());
      }
      return pairs;
    };
  }
  const kestrelctl::FsckReport report = kestrelctl::checkContainerStore(list);
  for (const std::string& problem : report.problems) std::cout << problem << "\n";
  for (const std::string& pending : report.pending) std::cout << "pending: " << pending << "\n";
  std::cout << report.containers << " containers in " << report.classDirectories
            << " class directories" << (offline ? "" : ", compared with the daemon's cache") << ": "
            << (report.problems.empty() ? "clean"
                                        : std::to_string(report.problems.size()) + " problems")
            << "\n";
  return report.problems.empty() ? kExitSuccess : kExitReplyError;
}

int run(int argc, char** argv) {
  CLI::App app{"Send a request to kestreld and print its reply."};
  app.footer(
      "Classes: 1..13 or Bundle/Application, Data/Application, Bundle/VantlerPlugin,\n"
      "Data/VantlerPlugin, Bundle/VPNPlugin, Data/VPNPlugin, Shared/AppGroup, Bundle/Framework,\n"
      "Data/VexelService, Data/InternalDaemon, Data/TempDir, Data/System, Shared/SystemGroup.\n"
      "call item types: u64, i64, bool, str, uuid, data (hex), plist (a JSON value).\n"
      "upcall exits 0 only for return code 0 with status 1.\n"
      "Examples: kestrelctl create --class Data/Application --user 501 "
      "--identifier com.example.app\n"
      "          kestrelctl call 0 ContainerClass=u64:2 UserID=u64:501 "
      "Identifier=str:com.example.app\n"
      "Exit status: 0 success (ReplyError 1), 1 other ReplyError, 2 usage, 3 unreachable,\n"
      "4 connection closed without a reply (refused), 5 D-Bus error reply, 6 internal failure.");
  app.require_subcommand(1);

  std::string root;
  std::string address;
  bool json = false;
  std::uint64_t timeoutSeconds = 120;
  auto* rootOption =
      app.add_option("--root", root, "Filesystem root of the daemon (default: $KESTREL_ROOT or /)");
  app.add_option("--address", address,
                 "D-Bus address, e.g. unix:path=/run/kestrel/com.zorvane.kestreld")
      ->excludes(rootOption);
  app.add_flag("--json", json, "Print the reply as JSON (call always does)");
  app.add_option("--timeout", timeoutSeconds, "Seconds to wait for the reply; 0 waits for ever")
      ->capture_default_str();

  std::string command;
  std::vector<std::string> items;
  CLI::App* call = app.add_subcommand("call", "Send one request");
  call->add_option("command", command, "Command index (uint64)")->required();
  call->add_option("items", items, "Request keys: key=type:value");
  call->add_option("--timeout", timeoutSeconds, "Seconds to wait for the reply; 0 waits for ever")
      ->capture_default_str();

  std::string plistFile;
  CLI::App* plist =
      app.add_subcommand("plist", "Print a property-list file (e.g. a metadata file) as JSON");
  plist->add_option("file", plistFile, "The file")->required();

  std::vector<std::string> protectionPaths;
  CLI::App* protectionClass = app.add_subcommand(
      "protection-class", "Print the data-protection class of files and directories");
  protectionClass->add_option("paths", protectionPaths, "The items")->required();
  protectionClass->fallthrough();

  bool offline = false;
  CLI::App* fsck = app.add_subcommand(
      "fsck", "Check the container store beneath the root (and the daemon's cache of it)");
  fsck->add_flag("--offline", offline, "Check the disk alone; do not ask the daemon");
  fsck->fallthrough();

  CLI::App* resetFirstBoot = app.add_subcommand(
      "reset-first-boot",
      "Forget that the boot-time work was done for the root (the daemon's next start redoes it)");
  resetFirstBoot->fallthrough();

  kestrelctl::UpcallRequestOptions upcallOptions;
  std::string upcallSocket;
  CLI::App* upcall = app.add_subcommand(
      "upcall", "Ask which containers a process gets, as the sandbox does at its start");
  upcall->add_option("--signing-identifier", upcallOptions.signingIdentifier,
                     "The process's code-signing identifier");
  upcall->add_option("--container-identifier", upcallOptions.containerIdentifier,
                     "Its container identifier, when it differs");
  upcall->add_option("--application-identifier", upcallOptions.applicationIdentifier,
                     "Its application identifier (sent, not used)");
  upcall->add_option("--persona", upcallOptions.persona, "The user whose containers are meant");
  upcall->add_option("--group", upcallOptions.groups, "An app group (repeatable)");
  upcall->add_option("--system-container", upcallOptions.systemContainer,
                     "A system container identifier");
  upcall->add_option("--system-group", upcallOptions.systemGroups,
                     "A system group container identifier (repeatable)");
  upcall->add_flag("--plugin", upcallOptions.plugin, "The process is a plug-in");
  upcall->add_option("--item", upcallOptions.items,
                     "A further request item: <value type>=u32:<n> or <value type>=str:<text>");
  upcall->add_option("--socket", upcallSocket,
                     "The upcall socket (default: <root>/run/kestrel/com.zorvane.kestreld.upcall)");
  upcall->fallthrough();

  // Sized up front: the options keep pointers into their entries.
  std::vector<NamedArguments> named(kestrelctl::subcommands().size());
  for (std::size_t i = 0; i < named.size(); ++i) {
    const kestrelctl::SubcommandInfo& info = kestrelctl::subcommands()[i];
    named[i].app = app.add_subcommand(std::string(info.name), std::string(info.summary));
    named[i].app->fallthrough();  // the global options may also follow the subcommand
    addNamedOptions(info, &named[i]);
  }

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kExitUsage;
  }

  if (plist->parsed()) return runPlist(plistFile);
  if (protectionClass->parsed()) return runProtectionClasses(protectionPaths, json);
  const platform::FilesystemRoot filesystemRoot =
      root.empty() ? platform::FilesystemRoot::fromEnvironment() : platform::FilesystemRoot(root);
  if (address.empty()) {
    address = "unix:path=" + platform::messageServiceSocketPath(filesystemRoot, kKSTServiceName);
  }
  if (resetFirstBoot->parsed()) return runResetFirstBoot(filesystemRoot);
  if (upcall->parsed()) {
    if (upcallSocket.empty()) {
      upcallSocket = platform::upcallSocketPath(filesystemRoot, kKSTUpcallServiceName);
    }
    return runUpcall(upcallSocket, upcallOptions, json, timeoutSeconds);
  }
  if (fsck->parsed()) return runFsck(filesystemRoot, address, offline, timeoutSeconds);
  for (std::size_t i = 0; i < named.size(); ++i) {
    if (named[i].app->parsed()) {
      return runNamed(address, kestrelctl::subcommands()[i], named[i], json, timeoutSeconds);
    }
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
