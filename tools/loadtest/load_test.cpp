// Load test: N clients, each on its own connection, issue a mixed workload
// against a running kestreld for a bounded time, on a small pool of random
// identifiers so that requests for the same container collide. Every answer
// is checked against the codes its request may legitimately get; anything
// else (or a broken connection) fails the run. The store itself is checked
// afterwards by `kestrelctl fsck` (scripts/load-test.sh).
//
//   kestrel_load_test --address A [--clients N] [--seconds S] [--identifiers K] [--seed X]
#include <atomic>
#include <chrono>
#include <cstdio>
#include <iostream>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "daemon_connection.h"

namespace {

using kestrel::bench::DaemonConnection;
using kestrel::platform::MessageDictionary;
using Clock = std::chrono::steady_clock;

struct Operation {
  const char* name;
  int weight;
  std::set<std::uint64_t> expected;  // codes this request may get
};

// The mix; weights are relative. Deletion may find nothing (21), lookup too.
const std::vector<Operation>& operations() {
  static const std::vector<Operation> mix = {
      {"create", 30, {1}},
      {"lookup", 20, {1, 21}},
      {"list", 10, {1}},
      {"renew-transient", 15, {1}},
      {"system-container", 8, {1}},
      {"delete", 12, {1, 21}},
      {"sweep", 5, {1}},
      // A transient container made and swapped in for the live one (or
      // installed when there is none). Another client may swap first, retire
      // the transient one or make the identifier live meanwhile.
      {"replace", 8, {1, 21, 27}},
      // Replaced by an empty container in place; a concurrent swap may take
      // the container or its fresh transient one away first.
      {"wipe", 6, {1, 21}},
  };
  return mix;
}

MessageDictionary requestFor(const std::string& name, const std::string& identifier) {
  MessageDictionary request;
  auto container = [&](std::uint64_t command, std::uint64_t containerClass) {
    request.setUint64("Command", command);
    request.setUint64("ContainerClass", containerClass);
    request.setUint64("UserID", 501);
    request.setString("Identifier", identifier);
  };
  if (name == "create" || name == "lookup") {
    container(0, 2);
    request.setBoolean("CreateIfNecessary", name == "create");
  } else if (name == "renew-transient") {
    container(0, 11);
    request.setBoolean("CreateIfNecessary", true);
    request.setBoolean("Transient", true);
  } else if (name == "list") {
    request.setUint64("Command", 1);
    request.setUint64("ContainerClass", 2);
    request.setUint64("UserID", 501);
  } else if (name == "system-container") {
    request.setUint64("Command", 15);
    request.setString("Identifier", "com.zorvane.egretd");
  } else if (name == "delete") {
    container(10, 2);
  } else if (name == "wipe") {
    container(12, 2);
  } else {
    request.setUint64("Command", 4);
  }
  return request;
}

// A replace: the live container (if any) looked up, a transient one made,
// and the swap; the swap's code, or the first step's when it failed.
std::uint64_t replace(DaemonConnection& connection, const std::string& identifier) {
  MessageDictionary lookup = requestFor("lookup", identifier);
  MessageDictionary old;
  const std::uint64_t found = connection.request(lookup, &old);
  if (found != 1 && found != 21) return found;
  MessageDictionary make = requestFor("create", identifier);
  make.setBoolean("Transient", true);
  MessageDictionary fresh;
  if (const std::uint64_t made = connection.request(make, &fresh); made != 1) return made;
  MessageDictionary swap;
  swap.setUint64("Command", 2);
  if (found == 1 && old.uuid("ReplyUUID")) {
    swap.setUuid("OldContainerUUID", *old.uuid("ReplyUUID"));
    swap.setUint64("OldContainerClass", 2);
    swap.setUint64("OldContainerUserID", 501);
    swap.setString("OldIdentifier", identifier);
  }
  swap.setUint64("NewContainerClass", 2);
  swap.setUint64("NewContainerUserID", 501);
  if (const auto uuid = fresh.uuid("ReplyUUID")) swap.setUuid("NewContainerUUID", *uuid);
  swap.setString("NewIdentifier", identifier);
  return connection.request(swap);
}

struct Tally {
  std::map<std::string, std::uint64_t> done;
  std::map<std::string, std::uint64_t> unexpected;  // "operation code"
  std::vector<std::string> failures;
};

int run(int argc, char** argv) {
  std::string address;
  int clients = 4;
  double seconds = 10;
  std::size_t identifiers = 40;
  std::uint64_t seed = std::random_device{}();
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    const std::string value = argv[i + 1];
    if (option == "--address")
      address = value;
    else if (option == "--clients")
      clients = std::stoi(value);
    else if (option == "--seconds")
      seconds = std::stod(value);
    else if (option == "--identifiers")
      identifiers = std::stoul(value);
    else if (option == "--seed")
      seed = std::stoull(value);
  }
  if (address.empty() || clients < 1 || identifiers < 1) {
    std::cerr << "usage: kestrel_load_test --address A [--clients N] [--seconds S] "
                 "[--identifiers K] [--seed X]\n";
    return 2;
  }

  // Random identifiers, fresh for every run.
  std::mt19937_64 names(seed);
  std::vector<std::string> pool;
  for (std::size_t i = 0; i < identifiers; ++i) {
    pool.push_back("com.example.load." + std::to_string(names() % 1000000000));
  }
  int totalWeight = 0;
  for (const Operation& op : operations()) totalWeight += op.weight;

  Tally tally;
  std::mutex tallyMutex;
  const auto deadline = Clock::now() + std::chrono::duration<double>(seconds);
  std::vector<std::thread> threads;
  for (int t = 0; t < clients; ++t) {
    threads.emplace_back([&, t] {
      Tally mine;
      try {
        DaemonConnection connection(address);
        std::mt19937_64 random(seed + static_cast<std::uint64_t>(t) + 1);
        while (Clock::now() < deadline) {
          int pick = static_cast<int>(random() % static_cast<std::uint64_t>(totalWeight));
          const Operation* op = &operations().front();
          for (const Operation& candidate : operations()) {
            if (pick < candidate.weight) {
              op = &candidate;
              break;
            }
            pick -= candidate.weight;
          }
          const std::string& identifier = pool[random() % pool.size()];
          const std::uint64_t code = std::string_view(op->name) == "replace"
                                         ? replace(connection, identifier)
                                         : connection.request(requestFor(op->name, identifier));
          ++mine.done[op->name];
          if (!op->expected.count(code)) {
            ++mine.unexpected[std::string(op->name) + " " + std::to_string(code)];
          }
        }
      } catch (const std::exception& e) {
        mine.failures.push_back("client " + std::to_string(t) + ": " + e.what());
      }
      std::lock_guard lock(tallyMutex);
      for (auto& [k, v] : mine.done) tally.done[k] += v;
      for (auto& [k, v] : mine.unexpected) tally.unexpected[k] += v;
      tally.failures.insert(tally.failures.end(), mine.failures.begin(), mine.failures.end());
    });
  }
  for (auto& thread : threads) thread.join();

  std::uint64_t total = 0;
  std::printf("load test: %d clients, %.0f s, %zu identifiers, seed %llu\n", clients, seconds,
              identifiers, static_cast<unsigned long long>(seed));
  for (const auto& [name, count] : tally.done) {
    std::printf("  %-18s %8llu\n", name.c_str(), static_cast<unsigned long long>(count));
    total += count;
  }
  std::printf("  %-18s %8llu (%.0f per second)\n", "all", static_cast<unsigned long long>(total),
              static_cast<double>(total) / seconds);
  for (const auto& [what, count] : tally.unexpected) {
    std::printf("UNEXPECTED: %s (x%llu)\n", what.c_str(), static_cast<unsigned long long>(count));
  }
  for (const std::string& failure : tally.failures) std::printf("FAILED: %s\n", failure.c_str());
  return tally.unexpected.empty() && tally.failures.empty() && total > 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& e) {
    std::cerr << "kestrel_load_test: " << e.what() << "\n";
    return 1;
  }
}
