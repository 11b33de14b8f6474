// Request benchmark: latency and throughput of a running kestreld, each
// figure beside a floor measured in the same run.
//
//   wake-up   the machine's thread wake-up latency, measured first: a thread
//             asleep on a futex for 20 us, or for 1 ms, woken by another;
//             every one-client figure below contains a few of these;
//   lookups   command 0 (no creation) of existing containers, with 1, 2 and 8
//             client connections, against org.freedesktop.DBus.Peer.Ping on
//             the same kind of connection to the same daemon, and against
//             the floor: the same request to a method of the benchmark build
//             that decodes it and answers with a reply of the same shape,
//             doing nothing else (the codec's share beside Ping);
//   creation  command 0 of new identifiers, against a baseline that makes the
//             same directories, metadata file (written, synced, renamed),
//             owners and final rename in-process, without the daemon; the
//             baseline runs twice, alternately, with and without the flushes
//             that make a creation survive a power loss (every directory of
//             the new container before the rename, the class directory and
//             those above it after), which gives the price of durability;
//   replace   command 2 of a transient container over a live one, against the
//             same system calls in-process, with and without the flushes.
//
//   kestrel_request_bench --address unix:path=... --root R --out DIR [--seconds S]
//                         [--only ping|floor|lookup|reject] [--clients N]
//
// Writes DIR/request_bench.json (figures and ratios) and DIR/latencies.csv
// (phase, clients, microseconds; one line a request) for plotting. The
// caller (bench/request.sh) starts the daemon and registers this binary as a
// client with the "allowed" entitlement.
#include <fcntl.h>
#include <linux/futex.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <memory>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "daemon_connection.h"
#include "platform/message_ipc.h"
#include "platform/plist.h"
#include "platform/plist_serialization.h"
#include "platform/unique_fd.h"
#include "platform/uuid.h"

namespace {

using Clock = std::chrono::steady_clock;
namespace fs = std::filesystem;
using kestrel::platform::MessageDictionary;

constexpr std::uint64_t kUser = 501;
constexpr std::uint64_t kClass = 2;  // Data/Application
constexpr std::size_t kPopulation = 1000;
constexpr std::size_t kCreations = 400;
constexpr std::size_t kReplaces = 200;

using Connection = kestrel::bench::DaemonConnection;

MessageDictionary containerRequest(const std::string& identifier, bool create) {
  MessageDictionary request;
  request.setUint64("Command", 0);
  request.setUint64("ContainerClass", kClass);
  request.setUint64("UserID", kUser);
  request.setString("Identifier", identifier);
  request.setBoolean("CreateIfNecessary", create);
  return request;
}

std::string identifierFor(const char* prefix, std::size_t index) {
  return std::string(prefix) + std::to_string(index);
}

struct Phase {
  std::string name;
  int clients = 1;
  std::vector<double> micros;  // one entry a request
  double seconds = 0;          // wall time of the phase

  double percentile(double p) const {
    if (micros.empty()) return 0;
    std::vector<double> sorted = micros;
    std::sort(sorted.begin(), sorted.end());
    const auto at = static_cast<std::size_t>(p * static_cast<double>(sorted.size() - 1));
    return sorted[at];
  }
  double throughput() const {
    return seconds > 0 ? static_cast<double>(micros.size()) / seconds : 0;
  }
};

// Runs body(connection, random) on `clients` threads, each with its own
// connection, for the given time; every call of body is one timed request.
template <typename Body>
Phase runTimed(const std::string& name, const std::string& address, int clients, double seconds,
               Body body) {
  std::vector<std::vector<double>> perThread(clients);
  std::atomic<bool> stop{false};
  std::atomic<int> ready{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < clients; ++t) {
    threads.emplace_back([&, t] {
      Connection connection(address);
      std::mt19937_64 random(static_cast<std::uint64_t>(t) * 7919 + 1);
      body(connection, random);  // warm-up, not counted
      ready.fetch_add(1);
      while (ready.load() < clients) std::this_thread::yield();
      while (!stop.load(std::memory_order_relaxed)) {
        const auto start = Clock::now();
        body(connection, random);
        perThread[t].push_back(
            std::chrono::duration<double, std::micro>(Clock::now() - start).count());
      }
    });
  }
  while (ready.load() < clients) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  const auto start = Clock::now();
  std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
  stop.store(true);
  for (auto& thread : threads) thread.join();
  Phase phase{name, clients, {}, std::chrono::duration<double>(Clock::now() - start).count()};
  for (auto& v : perThread) phase.micros.insert(phase.micros.end(), v.begin(), v.end());
  return phase;
}

// The same system calls as a creation, without the daemon: the staging
// directory and its five sub-directories with owners, the metadata file
// written, synced and renamed into place (and its directory synced), and the
// rename into the class directory; when durable, also the flushes of every
// directory of the new container before that rename and of the class
// directory and the five above it (up to the root, as for a mobile user's
// container) after it.
//
// And the same for a replace: the journal written atomically, the old
// container parked in staging, the new one renamed into place and, when
// durable, the three directories those renames changed flushed with those
// above them; then staging and journal moved into death-row holders.
class SyscallBaseline {
 public:
  explicit SyscallBaseline(const std::string& root)
      : root_(root),
        staging_(root + "/bench-baseline/Staging"),
        live_(root + "/private/var/bench-baseline/Containers/Data/Application"),
        transient_(root + "/private/var/bench-baseline/Temp/Data/Application"),
        journals_(root + "/bench-baseline/Replace"),
        deathRow_(root + "/bench-baseline/Dead") {
    for (const std::string& d : {staging_, live_, transient_, journals_, deathRow_}) {
      fs::create_directories(d);
    }
  }

  // An old container in place and a new one in the transient directory.
  std::pair<std::string, std::string> prepareReplace() {
    const std::string old = live_ + "/" + kestrel::platform::Uuid::random().string();
    const std::string fresh = transient_ + "/" + kestrel::platform::Uuid::random().string();
    for (const std::string& d : {old, fresh}) {
      mkdirOwned(d);
      mkdirOwned(d + "/Documents");
    }
    return {old, fresh};
  }

  void replaceOne(const std::pair<std::string, std::string>& containers, bool durable) {
    const auto& [old, fresh] = containers;
    const std::string id = kestrel::platform::Uuid::random().string();
    const std::string parked = staging_ + "/" + id;
    const std::string destination = live_ + "/" + fs::path(fresh).filename().string();
    const std::string journal = journals_ + "/" + id + ".plist";
    const kestrel::PlistDictionary paths{
        {"KSTReplaceOperationOldURL", kestrel::PlistValue(old)},
        {"KSTReplaceOperationNewURL", kestrel::PlistValue(fresh)},
        {"KSTReplaceOperationStagingURL", kestrel::PlistValue(parked)},
        {"KSTReplaceOperationDestURL", kestrel::PlistValue(destination)}};
    writeAtomically(journal, *kestrel::platform::serializeBinaryPropertyList(
                                 kestrel::PlistValue(paths), nullptr));
    if (::rename(old.c_str(), parked.c_str()) != 0 ||
        ::rename(fresh.c_str(), destination.c_str()) != 0) {
      throw std::runtime_error("rename");
    }
    if (durable) {
      for (const std::string& changed : {live_, staging_, transient_}) {
        for (fs::path d = changed; d != root_; d = d.parent_path()) sync(d);
      }
    }
    for (const std::string& item : {parked, journal}) {
      std::string holder = deathRow_ + "/temp.XXXXXX";
      if (::mkdtemp(holder.data()) == nullptr ||
          ::rename(item.c_str(), (holder + "/" + fs::path(item).filename().string()).c_str()) !=
              0) {
        throw std::runtime_error("death row");
      }
    }
  }

  void createOne(std::size_t index, bool durable) {
    const std::string name = kestrel::platform::Uuid::random().string();
    const std::string top = staging_ + "/" + name;
    mkdirOwned(top);
    kestrel::PlistDictionary metadata{
        {"KSTMetadataIdentifier",
         kestrel::PlistValue(identifierFor("com.example.baseline.", index))},
        {"KSTMetadataUUID", kestrel::PlistValue(kestrel::platform::Uuid::random().string())},
        {"KSTMetadataContentClass", kestrel::PlistValue(std::uint64_t{kClass})},
        {"KSTMetadataPersona", kestrel::PlistValue(std::uint64_t{kUser})}};
    const auto bytes = kestrel::platform::serializeBinaryPropertyList(
        kestrel::PlistValue(std::move(metadata)), nullptr);
    writeAtomically(top + "/.com.zorvane.kestrel.metadata.plist", *bytes);
    for (const char* sub :
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"}) {
      mkdirOwned(top + "/" + sub);
    }
    if (durable) {
      for (const char* sub :
           {"Documents", "Library/Caches", "Library/Preferences", "Library", "tmp", ""}) {
        sync(top + "/" + sub);
      }
    }
    if (::rename(top.c_str(), (live_ + "/" + name).c_str()) != 0)
      throw std::runtime_error("rename");
    if (durable) {
      for (fs::path directory = live_; directory != root_; directory = directory.parent_path()) {
        sync(directory);
      }
    }
  }

 private:
  static void sync(const fs::path& directory) {
    kestrel::platform::UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd || ::fsync(fd.get()) != 0) throw std::runtime_error("fsync " + directory.string());
  }
  static void mkdirOwned(const std::string& path) {
    if (::mkdir(path.c_str(), 0755) != 0 || ::chown(path.c_str(), kUser, kUser) != 0) {
      throw std::runtime_error("mkdir " + path);
    }
  }
  static void writeAtomically(const std::string& path, const std::vector<std::uint8_t>& bytes) {
    const std::string temporary = path + ".tmp";
    kestrel::platform::UniqueFd fd(
        ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
    if (!fd ||
        ::write(fd.get(), bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) ||
        ::fsync(fd.get()) != 0 || ::rename(temporary.c_str(), path.c_str()) != 0) {
      throw std::runtime_error("write " + path);
    }
    const std::string parent = fs::path(path).parent_path();
    kestrel::platform::UniqueFd directory(
        ::open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directory) ::fsync(directory.get());
  }

  fs::path root_;
  std::string staging_;
  std::string live_;
  std::string transient_;
  std::string journals_;
  std::string deathRow_;
};

Phase timedLoop(const std::string& name, std::size_t count,
                const std::function<void(std::size_t)>& body) {
  Phase phase{name, 1, {}, 0};
  const auto start = Clock::now();
  for (std::size_t i = 0; i < count; ++i) {
    const auto t0 = Clock::now();
    body(i);
    phase.micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
  }
  phase.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  return phase;
}

void printTable(const std::vector<Phase>& phases) {
  std::printf("%-26s %7s %9s %10s %10s %10s %12s\n", "phase", "clients", "requests", "p50 us",
              "p90 us", "p99 us", "per second");
  for (const Phase& p : phases) {
    std::printf("%-26s %7d %9zu %10.1f %10.1f %10.1f %12.0f\n", p.name.c_str(), p.clients,
                p.micros.size(), p.percentile(0.5), p.percentile(0.9), p.percentile(0.99),
                p.throughput());
  }
}

// The machine's wake-up latency: a thread asleep on a futex is woken by
// another, which waited `asleep` first (spinning, so only the sleeper's core
// goes idle), and the time from the wake call to the sleeper running is
// taken; p50 in microseconds over `rounds` wake-ups. A core left idle longer
// is slower to come back on a virtual machine.
double measureWakeUpMicros(std::size_t rounds, std::chrono::microseconds asleep) {
  alignas(64) std::atomic<std::uint32_t> turn{0};
  std::atomic<std::int64_t> ranAt{0};
  auto* word = reinterpret_cast<std::uint32_t*>(&turn);
  auto nowNanos = [] {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now().time_since_epoch())
        .count();
  };
  std::thread sleeper([&] {
    for (std::size_t i = 0; i < rounds; ++i) {
      while (turn.load() == 0) {
        ::syscall(SYS_futex, word, FUTEX_WAIT_PRIVATE, 0, nullptr, nullptr, 0);
      }
      ranAt.store(nowNanos());
      turn.store(0);
    }
  });
  Phase phase{"wake-up", 1, {}, 0};
  for (std::size_t i = 0; i < rounds; ++i) {
    for (const auto until = Clock::now() + asleep; Clock::now() < until;) {
    }
    const std::int64_t wokenAt = nowNanos();
    turn.store(1);
    ::syscall(SYS_futex, word, FUTEX_WAKE_PRIVATE, 1, nullptr, nullptr, 0);
    while (turn.load() != 0) {
    }
    phase.micros.push_back(static_cast<double>(ranAt.load() - wokenAt) / 1000.0);
  }
  sleeper.join();
  return phase.percentile(0.5);
}

void lookupOne(Connection& c, std::mt19937_64& random) {
  const std::size_t i = random() % kPopulation;
  if (c.request(containerRequest(identifierFor("com.example.bench.", i), false)) != 1) {
    throw std::runtime_error("lookup failed");
  }
}

void floorOne(Connection& c, std::mt19937_64& random) {
  const std::size_t i = random() % kPopulation;
  if (c.floor(containerRequest(identifierFor("com.example.bench.", i), false)) != 1) {
    throw std::runtime_error("floor failed");
  }
}

// `--only ping|floor|lookup|reject`: that phase with 1, 2 and 8 clients (or
// those of --clients), to profile the daemon while it runs.
int runOnly(const std::string& only, const std::string& address, double seconds,
            const std::vector<int>& clientCounts) {
  std::vector<Phase> phases;
  for (int clients : clientCounts) {
    if (only == "ping") {
      phases.push_back(runTimed("ping", address, clients, seconds,
                                [](Connection& c, std::mt19937_64&) { c.ping(); }));
    } else if (only == "floor") {
      phases.push_back(runTimed("floor", address, clients, seconds, floorOne));
    } else if (only == "lookup") {
      phases.push_back(runTimed("lookup", address, clients, seconds, lookupOne));
    } else if (only == "reject") {
      // A lookup's request naming no valid class: the transport, admission
      // and the request's decoding, without the lookup itself.
      phases.push_back(runTimed("reject", address, clients, seconds, [](Connection& c, auto&) {
        MessageDictionary request = containerRequest(identifierFor("com.example.bench.", 0), false);
        request.setUint64("ContainerClass", 999);
        if (c.request(request) == 1) throw std::runtime_error("class 999 was accepted");
      }));
    } else {
      std::cerr << "--only takes ping, floor, lookup or reject\n";
      return 2;
    }
  }
  printTable(phases);
  return 0;
}

int run(int argc, char** argv) {
  std::string address, root, out;
  double seconds = 3;
  std::string only;  // one phase alone, for profiling: no ratios, no files
  std::vector<int> clientCounts{1, 2, 8};
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    if (option == "--address")
      address = argv[i + 1];
    else if (option == "--root")
      root = argv[i + 1];
    else if (option == "--out")
      out = argv[i + 1];
    else if (option == "--seconds")
      seconds = std::stod(argv[i + 1]);
    else if (option == "--only")
      only = argv[i + 1];
    else if (option == "--clients")
      clientCounts = {std::stoi(argv[i + 1])};
  }
  if (address.empty() || root.empty() || out.empty()) {
    std::cerr << "usage: kestrel_request_bench --address A --root R --out DIR [--seconds S] "
                 "[--only ping|floor|lookup|reject] [--clients N]\n";
    return 2;
  }

  // The containers the lookups find.
  {
    Connection connection(address);
    for (std::size_t i = 0; i < kPopulation; ++i) {
      if (connection.request(containerRequest(identifierFor("com.example.bench.", i), true)) != 1) {
        std::cerr << "could not create the population\n";
        return 1;
      }
    }
  }

  std::vector<Phase> phases;
  if (!only.empty()) return runOnly(only, address, seconds, clientCounts);
  // Asleep as long as a connection thread between a Ping's requests, and longer.
  const double wakeUpMicros = measureWakeUpMicros(5000, std::chrono::microseconds(20));
  const double wakeUpAfterIdleMicros = measureWakeUpMicros(500, std::chrono::microseconds(1000));
  std::printf("thread wake-up p50 (futex; asleep 20 us / 1 ms): %.1f / %.1f us\n\n", wakeUpMicros,
              wakeUpAfterIdleMicros);
  for (int clients : {1, 2, 8}) {
    phases.push_back(runTimed("ping", address, clients, seconds,
                              [](Connection& c, std::mt19937_64&) { c.ping(); }));
    phases.push_back(runTimed("floor", address, clients, seconds, floorOne));
    phases.push_back(runTimed("lookup", address, clients, seconds, lookupOne));
  }
  {
    Connection connection(address);
    phases.push_back(timedLoop("create", kCreations, [&](std::size_t i) {
      if (connection.request(containerRequest(identifierFor("com.example.new.", i), true)) != 1) {
        throw std::runtime_error("creation failed");
      }
    }));
    // Alternately, so that both see the same disk and the same neighbours.
    SyscallBaseline baseline(root);
    Phase plain{"create-syscalls", 1, {}, 0};
    Phase durable{"create-syscalls-durable", 1, {}, 0};
    for (std::size_t i = 0; i < kCreations; ++i) {
      for (Phase* phase : {&plain, &durable}) {
        const auto t0 = Clock::now();
        baseline.createOne(2 * i + (phase == &durable ? 1 : 0), phase == &durable);
        const double micros = std::chrono::duration<double, std::micro>(Clock::now() - t0).count();
        phase->micros.push_back(micros);
        phase->seconds += micros / 1e6;
      }
    }
    phases.push_back(std::move(plain));
    phases.push_back(std::move(durable));

    // Replaces: a live and a transient container of one identifier each,
    // made beforehand; only the swap is timed.
    std::vector<std::pair<kestrel::platform::Uuid, kestrel::platform::Uuid>> pairs;
    for (std::size_t i = 0; i < kReplaces; ++i) {
      const std::string identifier = identifierFor("com.example.swap.", i);
      MessageDictionary old, fresh;
      MessageDictionary transient = containerRequest(identifier, true);
      transient.setBoolean("Transient", true);
      if (connection.request(containerRequest(identifier, true), &old) != 1 ||
          connection.request(transient, &fresh) != 1) {
        throw std::runtime_error("replace preparation failed");
      }
      pairs.emplace_back(*old.uuid("ReplyUUID"), *fresh.uuid("ReplyUUID"));
    }
    phases.push_back(timedLoop("replace", kReplaces, [&](std::size_t i) {
      MessageDictionary swap;
      swap.setUint64("Command", 2);
      swap.setUuid("OldContainerUUID", pairs[i].first);
      swap.setUuid("NewContainerUUID", pairs[i].second);
      for (const char* side : {"Old", "New"}) {
        swap.setUint64(std::string(side) + "ContainerClass", kClass);
        swap.setUint64(std::string(side) + "ContainerUserID", kUser);
        swap.setString(std::string(side) + "Identifier", identifierFor("com.example.swap.", i));
      }
      if (connection.request(swap) != 1) throw std::runtime_error("replace failed");
    }));
    Phase plainReplace{"replace-syscalls", 1, {}, 0};
    Phase durableReplace{"replace-syscalls-durable", 1, {}, 0};
    for (std::size_t i = 0; i < kReplaces; ++i) {
      for (Phase* phase : {&plainReplace, &durableReplace}) {
        const auto containers = baseline.prepareReplace();
        const auto t0 = Clock::now();
        baseline.replaceOne(containers, phase == &durableReplace);
        const double micros = std::chrono::duration<double, std::micro>(Clock::now() - t0).count();
        phase->micros.push_back(micros);
        phase->seconds += micros / 1e6;
      }
    }
    phases.push_back(std::move(plainReplace));
    phases.push_back(std::move(durableReplace));
  }

  fs::create_directories(out);
  std::ofstream csv(out + "/latencies.csv");
  csv << "phase,clients,micros\n";
  nlohmann::json result;
  result["population"] = kPopulation;
  result["wake_up_p50_us"] = wakeUpMicros;
  result["wake_up_after_1ms_asleep_p50_us"] = wakeUpAfterIdleMicros;
  result["seconds_per_phase"] = seconds;
  auto find = [&](const std::string& name, int clients) -> const Phase& {
    for (const Phase& p : phases) {
      if (p.name == name && p.clients == clients) return p;
    }
    throw std::runtime_error("no phase " + name);
  };
  for (const Phase& p : phases) {
    for (double v : p.micros) csv << p.name << "," << p.clients << "," << v << "\n";
    result["phases"].push_back({{"phase", p.name},
                                {"clients", p.clients},
                                {"requests", p.micros.size()},
                                {"p50_us", p.percentile(0.5)},
                                {"p90_us", p.percentile(0.9)},
                                {"p99_us", p.percentile(0.99)},
                                {"throughput_per_s", p.throughput()}});
  }
  nlohmann::json ratios;
  // Two clients first: they keep both cores awake, so their figures are not
  // made of wake-ups.
  for (int clients : {2, 1, 8}) {
    const std::string suffix = "_" + std::to_string(clients) + "_clients";
    ratios["lookup_p50_over_ping_p50" + suffix] =
        find("lookup", clients).percentile(0.5) / find("ping", clients).percentile(0.5);
    ratios["floor_p50_over_ping_p50" + suffix] =
        find("floor", clients).percentile(0.5) / find("ping", clients).percentile(0.5);
    ratios["lookup_p50_over_floor_p50" + suffix] =
        find("lookup", clients).percentile(0.5) / find("floor", clients).percentile(0.5);
  }
  ratios["ping_p50_1_client_over_wake_up_p50"] = find("ping", 1).percentile(0.5) / wakeUpMicros;
  // The daemon makes the durable calls, so that is its floor.
  ratios["create_p50_over_syscalls_p50"] =
      find("create", 1).percentile(0.5) / find("create-syscalls-durable", 1).percentile(0.5);
  ratios["replace_p50_over_syscalls_p50"] =
      find("replace", 1).percentile(0.5) / find("replace-syscalls-durable", 1).percentile(0.5);
  ratios["durable_replace_syscalls_p50_over_plain_p50"] =
      find("replace-syscalls-durable", 1).percentile(0.5) /
      find("replace-syscalls", 1).percentile(0.5);
  ratios["durable_syscalls_p50_over_plain_syscalls_p50"] =
      find("create-syscalls-durable", 1).percentile(0.5) /
      find("create-syscalls", 1).percentile(0.5);
  ratios["lookup_throughput_2_clients_over_1"] =
      find("lookup", 2).throughput() / find("lookup", 1).throughput();
  ratios["lookup_throughput_8_clients_over_1"] =
      find("lookup", 8).throughput() / find("lookup", 1).throughput();
  result["ratios"] = ratios;
  result["targets"] = {{"lookup_p50_over_ping_p50_2_clients", 2.0},
                       {"lookup_p50_over_ping_p50_1_clients", 1.6},
                       {"create_p50_over_syscalls_p50", 1.5},
                       {"lookup_throughput_2_clients_over_1", 1.6}};
  std::ofstream(out + "/request_bench.json") << result.dump(2) << "\n";

  printTable(phases);
  std::printf("\nRatios (target in brackets):\n");
  for (auto& [key, value] : ratios.items()) {
    std::printf("  %-42s %6.2fx\n", key.c_str(), value.get<double>());
  }
  std::printf(
      "  [lookup p50 <= 2x ping p50 with 2 clients, <= 1.6x with 1; creation <= 1.5x "
      "syscalls; 2 clients >= 1.6x one]\n");
  std::printf("  thread wake-up p50 in this run (asleep 20 us / 1 ms): %.1f / %.1f us\n",
              wakeUpMicros, wakeUpAfterIdleMicros);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& e) {
    std::cerr << "kestrel_request_bench: " << e.what() << "\n";
    return 1;
  }
}
