// Crash-injection driver: proves that a crash at any durable step of create,
// replace, wipe, stage-for-delete, death row, recovery and start-up clean-up
// leaves every container in its state before or after the request.
//
// Each trial: a fresh root copied from a template; the daemon (a build with
// crash points) sets up the state before; it is started again with
// KESTREL_CRASH_AT naming the point, and a workload is driven through it
// until the daemon is killed there; it is started once more, without, and
// then the store is checked: `kestrelctl fsck` (disk against the daemon's
// cache), Staging and Replace empty after housekeeping, every lookup
// answered, and each container of the scenario whole in its before or after
// state, none lost, none twice.
//
//   kestrel_crash_test --daemon D --ctl C --template T [--trials N] [--point P]...
//                      [--seed S] [--keep-failed K]
#include <fcntl.h>
#include <linux/fs.h>
#include <signal.h>
#include <spawn.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <optional>
#include <random>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "daemon_connection.h"
#include "platform/uuid.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;
using kestrel::bench::DaemonConnection;
using kestrel::platform::MessageDictionary;
using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr const char* kApp = "com.crash.app";
constexpr std::uint64_t kUser = 501;
constexpr const char* kSocket = "/run/kestrel/com.zorvane.kestreld";
constexpr const char* kMarker = "/Documents/marker";
constexpr const char* kTransientClassDirectory =
    "/private/var/mobile/Library/Caches/com.zorvane.kestreld/Temp/Data/Application";

struct Options {
  std::string daemon;
  std::string ctl;
  std::string templateRoot;
  std::size_t trials = 100;
  std::vector<std::string> points;
  std::uint64_t seed = std::random_device{}();
  std::size_t keepFailed = 3;
};

// Runs a program to its end; its exit status (-1 when it could not run).
int runQuietly(const std::vector<std::string>& args, std::string* output = nullptr) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) return -1;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDERR_FILENO);
  std::vector<char*> argv;
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  pid_t pid = -1;
  const int spawned = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  ::close(fds[1]);
  std::string text;
  char buffer[4096];
  for (ssize_t n; (n = ::read(fds[0], buffer, sizeof buffer)) > 0;) text.append(buffer, size_t(n));
  ::close(fds[0]);
  if (output) *output = text;
  if (spawned != 0) return -1;
  int status = 0;
  ::waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

kestrel::platform::Uuid uuidOf(const std::string& text) {
  const auto uuid = kestrel::platform::Uuid::parse(text);
  if (!uuid) throw std::runtime_error("no UUID: '" + text + "'");
  return *uuid;
}

int setImmutable(const std::string& path, bool on) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  int flags = 0;
  int result = ::ioctl(fd, FS_IOC_GETFLAGS, &flags);
  if (result == 0) {
    flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    result = ::ioctl(fd, FS_IOC_SETFLAGS, &flags);
  }
  ::close(fd);
  return result == 0 ? 0 : errno;
}

// What a lookup of a container found.
struct Found {
  std::uint64_t code = 0;
  std::string path;
  std::string uuid;
  std::string marker;  // the marker file's contents, "" when there is none
};

// What a check found: the state the scenario's containers were in, and
// anything wrong.
struct Problems {
  std::string state = "?";
  std::vector<std::string> lines;
  void push_back(std::string line) { lines.push_back(std::move(line)); }
  bool empty() const { return lines.empty(); }
};

// One root and the daemon on it.
class Trial {
 public:
  Trial(const Options& options, std::mt19937_64& random) : options_(options), random_(random) {
    char pattern[] = "/tmp/kestrel-crash.XXXXXX";
    if (::mkdtemp(pattern) == nullptr) throw std::runtime_error("mkdtemp");
    root_ = pattern;
    ::rmdir(root_.c_str());
    if (runQuietly({"/bin/cp", "-a", options_.templateRoot, root_}) != 0) {
      throw std::runtime_error("cannot copy the template root");
    }
  }
  ~Trial() { stop(); }

  const std::string& root() const { return root_; }
  std::string address() const { return "unix:path=" + root_ + kSocket; }

  // Starts the daemon (crashing at the point when one is given) and waits
  // until it serves, or until it died. True when it serves.
  bool start(const std::string& crashAt = {}) {
    ::unlink((root_ + kSocket).c_str());
    std::vector<std::string> env;
    for (char** e = environ; *e != nullptr; ++e) env.emplace_back(*e);
    env.push_back("KESTREL_ROOT=" + root_);
    if (!crashAt.empty()) env.push_back("KESTREL_CRASH_AT=" + crashAt);
    std::vector<char*> envp;
    for (auto& e : env) envp.push_back(e.data());
    envp.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    char* argv[] = {const_cast<char*>(options_.daemon.c_str()), nullptr};
    const int spawned = posix_spawn(&pid_, argv[0], &actions, nullptr, argv, envp.data());
    posix_spawn_file_actions_destroy(&actions);
    if (spawned != 0) throw std::runtime_error("cannot start the daemon");
    // Serving means answering: the socket may exist a moment before it listens.
    const auto deadline = Clock::now() + 30s;
    while (Clock::now() < deadline) {
      struct stat st {};
      if (::stat((root_ + kSocket).c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
        try {
          DaemonConnection(address()).ping();
          return true;
        } catch (const std::exception&) {
        }
      }
      if (reaped()) return false;
      std::this_thread::sleep_for(5ms);
    }
    throw std::runtime_error("the daemon neither served nor died");
  }

  // True once the daemon was killed (SIGKILL) within the time.
  bool killedWithin(std::chrono::milliseconds limit) {
    const auto deadline = Clock::now() + limit;
    while (Clock::now() < deadline) {
      if (reaped()) return killed_;
      std::this_thread::sleep_for(5ms);
    }
    return false;
  }

  void stop() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGTERM);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    pid_ = -1;
  }

  // A request on a connection of its own; 0 when the connection broke.
  std::uint64_t request(const MessageDictionary& request, MessageDictionary* reply = nullptr) {
    try {
      DaemonConnection connection(address());
      return connection.request(request, reply);
    } catch (const std::exception&) {
      return 0;
    }
  }

  std::uint64_t container(std::uint64_t command, const std::string& identifier, bool create,
                          bool transient, MessageDictionary* reply = nullptr) {
    MessageDictionary message;
    message.setUint64("Command", command);
    message.setUint64("ContainerClass", 2);
    message.setUint64("UserID", kUser);
    message.setString("Identifier", identifier);
    message.setBoolean("CreateIfNecessary", create);
    message.setBoolean("Transient", transient);
    return request(message, reply);
  }

  // The live container of the identifier, as command 0 finds it.
  Found lookup(const std::string& identifier) {
    MessageDictionary reply;
    Found found;
    found.code = container(0, identifier, false, false, &reply);
    return found.code == 1 ? described(reply, found) : found;
  }

  // The transient container of the identifier. Command 0 would retire it, so
  // it is listed instead and found on disk by its marker.
  Found transient(const std::string& identifier) {
    MessageDictionary message, reply;
    message.setUint64("Command", 1);
    message.setUint64("ContainerClass", 2);
    message.setUint64("UserID", kUser);
    message.setBoolean("Transient", true);
    Found found;
    found.code = request(message, &reply);
    const auto* ids = reply.array("ReplyIdsArray");
    const auto* uuids = reply.array("ReplyUUIDsArray");
    if (found.code != 1 || !ids || !uuids) return found;
    found.code = 21;
    for (std::size_t i = 0; i < ids->size() && i < uuids->size(); ++i) {
      if ((*ids)[i].string() && *(*ids)[i].string() == identifier && (*uuids)[i].uuid()) {
        found.code = 1;
        found.uuid = (*uuids)[i].uuid()->string();
      }
    }
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(root_ + kTransientClassDirectory, ec)) {
      if (fs::exists(entry.path().string() + kMarker)) {
        found.path = entry.path();
        found.marker = readFile(found.path + kMarker);
      }
    }
    return found;
  }

  // Creates the container (with a marker file) and gives what the reply says.
  Found make(const std::string& identifier, bool transient, const std::string& marker) {
    MessageDictionary reply;
    Found made;
    made.code = container(0, identifier, true, transient, &reply);
    if (made.code != 1) throw std::runtime_error("cannot make " + identifier);
    described(reply, made);
    std::ofstream(made.path + kMarker) << marker;
    made.marker = marker;
    return made;
  }

  std::uint64_t replace(const Found& old, const Found& fresh) {
    MessageDictionary message;
    message.setUint64("Command", 2);
    if (!old.uuid.empty()) {
      message.setUuid("OldContainerUUID", uuidOf(old.uuid));
      message.setUint64("OldContainerClass", 2);
      message.setUint64("OldContainerUserID", kUser);
      message.setString("OldIdentifier", kApp);
    }
    message.setUint64("NewContainerClass", 2);
    message.setUint64("NewContainerUserID", kUser);
    message.setUuid("NewContainerUUID", uuidOf(fresh.uuid));
    message.setString("NewIdentifier", kApp);
    return request(message);
  }

  static Found& described(const MessageDictionary& reply, Found& found) {
    found.path = reply.string("ReplyPath").value_or("");
    if (const auto uuid = reply.uuid("ReplyUUID")) found.uuid = uuid->string();
    if (fs::exists(found.path + kMarker)) found.marker = readFile(found.path + kMarker);
    return found;
  }

  // Other containers, so that no trial works on an empty store.
  void populate() {
    const std::size_t count = random_() % 4;
    for (std::size_t i = 0; i < count; ++i) {
      container(0, "com.crash.other." + std::to_string(random_() % 100000), true, false);
    }
  }

  // The checks every trial ends with; problems are appended.
  void checkStore(Problems* problems) {
    std::string output;
    if (runQuietly({options_.ctl, "--root", root_, "fsck"}, &output) != 0) {
      problems->push_back("fsck: " + output);
    }
    for (const char* directory : {"/private/var/root/Library/Caches/com.zorvane.kestreld/Staging",
                                  "/private/var/root/Library/Kestrel/Replace"}) {
      std::error_code ec;
      for (const auto& entry : fs::directory_iterator(root_ + directory, ec)) {
        problems->push_back("left after start-up: " + entry.path().string());
      }
    }
  }

  // Removes the root (and the first-boot mark the daemon made for it).
  void remove() {
    stop();
    runQuietly({options_.ctl, "--root", root_, "reset-first-boot"});
    for (const auto& entry :
         fs::recursive_directory_iterator(root_, fs::directory_options::skip_permission_denied)) {
      if (entry.is_directory() && !entry.is_symlink()) setImmutable(entry.path(), false);
    }
    std::error_code ec;
    fs::remove_all(root_, ec);
  }

 private:
  bool reaped() {
    if (pid_ <= 0) return true;
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) != pid_) return false;
    killed_ = WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL;
    pid_ = -1;
    return true;
  }

  const Options& options_;
  std::mt19937_64& random_;
  std::string root_;
  pid_t pid_ = -1;
  bool killed_ = false;
};

// What a scenario set up before the crash, for its check.
struct Before {
  Found old;
  Found fresh;
};

// The live container of kApp holds the old content or the new one, whole, and
// the transient one is there exactly when the swap did not happen.
void checkReplaced(Trial& trial, const Before& before, Problems* problems) {
  const Found live = trial.lookup(kApp);
  const Found transient = trial.transient(kApp);
  if (live.code != 1) {
    problems->push_back("no live container after replace: code " + std::to_string(live.code));
    return;
  }
  if (live.marker == "old" && live.uuid == before.old.uuid) {
    problems->state = "before";
    if (transient.code != 1 || transient.marker != "new") {
      problems->push_back("replace not done, but the new container is lost");
    }
  } else if (live.marker == "new" && live.uuid == before.fresh.uuid) {
    problems->state = "after";
    if (transient.code != 21) problems->push_back("replaced, but a transient one remains");
  } else {
    problems->push_back("live container in neither state: marker '" + live.marker + "' uuid " +
                        live.uuid);
  }
}

struct Scenario {
  std::string name;
  std::vector<std::string> points;
  std::function<Before(Trial&)> setup;
  std::function<void(Trial&, const Before&)> workload;
  // A crash during start-up: the point is reached by starting the daemon.
  bool crashesAtStart = false;
  std::function<void(Trial&, const Before&, Problems*)> check;
};

// A replace killed at its first point leaves a state that the restarted
// daemon must deal with; these scenarios crash it again while it does.
struct SecondCrash {
  const char* name;
  std::vector<std::string> points;
  const char* firstCrash;  // where the replace that leaves the state behind is killed
};

std::vector<Scenario> makeScenarios() {
  std::vector<Scenario> all = {
      {"create",
       {"create.metadata-written", "create.in-place", "create.cached"},
       [](Trial&) { return Before{}; },
       [](Trial& t, const Before&) { t.container(0, "com.crash.new", true, false); },
       false,
       [](Trial& t, const Before&, Problems* p) {
         const Found found = t.lookup("com.crash.new");
         p->state = found.code == 1 ? "after" : "before";
         if (found.code != 1 && found.code != 21) {
           p->push_back("lookup after create: code " + std::to_string(found.code));
         } else if (found.code == 1 && !fs::is_directory(found.path + "/Library/Preferences")) {
           p->push_back("created container is not whole: " + found.path);
         }
       }},
      {"renew-transient",
       {"create.transient-retired", "death-row.holder-made", "death-row.moved"},
       [](Trial& t) {
         t.make("com.crash.scratch", true, "first");
         return Before{};
       },
       [](Trial& t, const Before&) { t.container(0, "com.crash.scratch", true, true); },
       false,
       [](Trial& t, const Before&, Problems* p) {
         // A transient container is disposable: renewed or not yet made again.
         const Found found = t.transient("com.crash.scratch");
         p->state = found.code == 1 ? (found.marker == "first" ? "before" : "after") : "between";
         if (found.code != 1 && found.code != 21) {
           p->push_back("transient lookup: code " + std::to_string(found.code));
         }
       }},
      {"replace",
       {"replace.journal-written", "replace.old-parked", "replace.new-in-place", "replace.cached",
        "replace.staging-retired", "replace.journal-retired", "death-row.holder-made",
        "death-row.moved"},
       [](Trial& t) {
         return Before{t.make(kApp, false, "old"), t.make(kApp, true, "new")};
       },
       [](Trial& t, const Before& b) { t.replace(b.old, b.fresh); },
       false,
       checkReplaced},
      {"replace-that-fails",
       {"replace.rolled-back"},
       [](Trial& t) {
         Before before{t.make(kApp, false, "old"), t.make(kApp, true, "new")};
         setImmutable(before.fresh.path, true);  // the new one cannot be moved
         return before;
       },
       [](Trial& t, const Before& b) { t.replace(b.old, b.fresh); },
       false,
       [](Trial& t, const Before& b, Problems* p) {
         setImmutable(b.fresh.path, false);
         checkReplaced(t, b, p);
       }},
      {"wipe",
       {"create.metadata-written", "create.in-place", "create.cached", "replace.uuid-written",
        "replace.journal-written", "replace.old-parked", "replace.new-in-place", "replace.cached",
        "replace.staging-retired", "replace.journal-retired"},
       [](Trial& t) {
         return Before{t.make(kApp, false, "old"), Found{}};
       },
       [](Trial& t, const Before&) {
         MessageDictionary message;
         message.setUint64("Command", 12);
         message.setUint64("ContainerClass", 2);
         message.setUint64("UserID", kUser);
         message.setString("Identifier", kApp);
         t.request(message);
       },
       false,
       [](Trial& t, const Before& b, Problems* p) {
         // Wiped or not, the container keeps its place and UUID.
         const Found live = t.lookup(kApp);
         p->state = live.marker == "old" ? "before" : "after";
         if (live.code != 1 || live.path != b.old.path || live.uuid != b.old.uuid) {
           p->push_back("wiped container moved or lost: code " + std::to_string(live.code) +
                        " path " + live.path + " uuid " + live.uuid);
         } else if (live.marker != "old" && live.marker != "") {
           p->push_back("wiped container holds '" + live.marker + "'");
         } else if (live.marker.empty() && !fs::is_directory(live.path + "/Library/Preferences")) {
           p->push_back("wiped container is not whole");
         }
       }},
      {"delete",
       {"delete.moved", "delete.uncached"},
       [](Trial& t) {
         return Before{t.make(kApp, false, "old"), Found{}};
       },
       [](Trial& t, const Before&) { t.container(10, kApp, false, false); },
       false,
       [](Trial& t, const Before&, Problems* p) {
         const Found live = t.lookup(kApp);
         p->state = live.code == 21 ? "after" : "before";
         if (!(live.code == 21 || (live.code == 1 && live.marker == "old"))) {
           p->push_back("deleted container in neither state: code " + std::to_string(live.code));
         }
       }},
  };
  const SecondCrash secondCrashes[] = {
      // The old container parked, and a journal.
      {"recovery",
       {"recovery.rolled-back", "recovery.journal-retired", "death-row.holder-made"},
       "replace.old-parked"},
      // The parked old container in staging, the swap done.
      {"cleanup", {"cleanup.staging-retired", "death-row.moved"}, "replace.new-in-place"},
  };
  for (const SecondCrash& second : secondCrashes) {
    const std::string firstCrash = second.firstCrash;
    all.push_back({second.name, second.points,
                   [firstCrash](Trial& t) {
                     Before before{t.make(kApp, false, "old"), t.make(kApp, true, "new")};
                     t.stop();
                     t.start(firstCrash);
                     t.replace(before.old, before.fresh);
                     t.killedWithin(20s);
                     return before;
                   },
                   nullptr, true, checkReplaced});
  }
  return all;
}

const std::vector<Scenario>& scenarios() {
  static const std::vector<Scenario> all = makeScenarios();
  return all;
}

struct Tally {
  std::size_t trials = 0;
  std::size_t failed = 0;
  std::map<std::string, std::size_t> states;  // state found after the restart -> trials
};

int run(const Options& options) {
  std::mt19937_64 random(options.seed);
  // Every (point, scenario) pair, in turn, until the trials are done.
  std::vector<std::pair<std::string, const Scenario*>> cases;
  for (const Scenario& scenario : scenarios()) {
    for (const std::string& point : scenario.points) {
      if (options.points.empty() ||
          std::find(options.points.begin(), options.points.end(), point) != options.points.end()) {
        cases.emplace_back(point, &scenario);
      }
    }
  }
  if (cases.empty()) {
    std::cerr << "no scenario passes those points\n";
    return 2;
  }
  std::map<std::string, Tally> byPoint;
  std::size_t kept = 0;
  const auto begun = Clock::now();
  for (std::size_t i = 0; i < options.trials; ++i) {
    const auto& [point, scenario] = cases[i % cases.size()];
    Problems problems;
    Trial trial(options, random);
    try {
      if (!trial.start()) throw std::runtime_error("the daemon did not start");
      trial.populate();
      const Before before = scenario->setup(trial);
      trial.stop();
      if (scenario->crashesAtStart) {
        if (trial.start(point)) {
          problems.push_back("start-up did not reach " + point);
          trial.stop();
        } else if (!trial.killedWithin(1s)) {
          problems.push_back("the daemon died, not at the point");
        }
      } else {
        if (!trial.start(point)) throw std::runtime_error("the daemon did not start to crash");
        scenario->workload(trial, before);
        if (!trial.killedWithin(20s)) {
          problems.push_back("the workload did not reach " + point);
          trial.stop();
        }
      }
      if (!trial.start()) throw std::runtime_error("the daemon did not start after the crash");
      scenario->check(trial, before, &problems);
      trial.checkStore(&problems);
    } catch (const std::exception& e) {
      problems.push_back(e.what());
    }
    Tally& tally = byPoint[point + " (" + scenario->name + ")"];
    ++tally.trials;
    ++tally.states[problems.state];
    if (problems.empty()) {
      trial.remove();
      continue;
    }
    ++tally.failed;
    std::printf("FAILED %s (%s), root %s:\n", point.c_str(), scenario->name.c_str(),
                trial.root().c_str());
    for (const std::string& problem : problems.lines) std::printf("  %s\n", problem.c_str());
    trial.stop();
    if (kept++ >= options.keepFailed) trial.remove();
  }

  std::size_t failed = 0;
  std::printf("%-48s %7s %7s  %s\n", "crash point (scenario)", "trials", "failed",
              "state after restart");
  for (const auto& [name, tally] : byPoint) {
    std::string states;
    for (const auto& [state, count] : tally.states) {
      states += (states.empty() ? "" : ", ") + state + " " + std::to_string(count);
    }
    std::printf("%-48s %7zu %7zu  %s\n", name.c_str(), tally.trials, tally.failed, states.c_str());
    failed += tally.failed;
  }
  std::printf("%zu trials, %zu failed, %.0f s, seed %llu\n", options.trials, failed,
              std::chrono::duration<double>(Clock::now() - begun).count(),
              static_cast<unsigned long long>(options.seed));
  return failed == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  Options options;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    const std::string value = argv[i + 1];
    if (option == "--daemon")
      options.daemon = value;
    else if (option == "--ctl")
      options.ctl = value;
    else if (option == "--template")
      options.templateRoot = value;
    else if (option == "--trials")
      options.trials = std::stoul(value);
    else if (option == "--point")
      options.points.push_back(value);
    else if (option == "--seed")
      options.seed = std::stoull(value);
    else if (option == "--keep-failed")
      options.keepFailed = std::stoul(value);
  }
  if (options.daemon.empty() || options.ctl.empty() || options.templateRoot.empty()) {
    std::cerr << "usage: kestrel_crash_test --daemon D --ctl C --template T [--trials N] "
                 "[--point P]... [--seed S] [--keep-failed K]\n";
    return 2;
  }
  try {
    return run(options);
  } catch (const std::exception& e) {
    std::cerr << "kestrel_crash_test: " << e.what() << "\n";
    return 1;
  }
}
