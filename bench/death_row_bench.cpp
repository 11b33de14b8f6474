// The death-row sweep of a 100,000-file tree against `rm -rf` of an identical
// tree, measured in the same run. Each tree is built (and flushed to disk)
// outside the timing; the sweep is timed from the request to its completion,
// so it includes the hop to the death-row queue, whose background threads run
// at the lowest CPU and idle I/O priority.
//
// The ratio is printed at the end of the run. Needs root (the scratch root chowns):
//   build/bench/bench/kestrel_death_row_bench    (or bench/run.sh --benchmark_filter=DeathRow)
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "platform/unique_fd.h"
#include "store/global_configuration.h"
#include "support/fake_services.h"

extern char** environ;

namespace kestrel {
namespace {

namespace fs = std::filesystem;

// 100 containers of 10 directories of 100 files.
constexpr int kContainers = 100;
constexpr int kDirectories = 10;
constexpr int kFiles = 100;

testing::FakeServices& fakes() {
  static testing::FakeServices instance;
  return instance;
}

// False (with a message) on any failure.
bool buildTree(const std::string& root) {
  static const char kContents[] = "a small file, as most in a container are\n";
  for (int c = 0; c < kContainers; ++c) {
    const std::string container = root + "/temp.c" + std::to_string(c) + "/Data";
    for (int d = 0; d < kDirectories; ++d) {
      const std::string directory = container + "/Library/d" + std::to_string(d);
      std::error_code ec;
      fs::create_directories(directory, ec);
      if (ec) {
        std::fprintf(stderr, "cannot make %s: %s\n", directory.c_str(), ec.message().c_str());
        return false;
      }
      for (int f = 0; f < kFiles; ++f) {
        const std::string file = directory + "/f" + std::to_string(f);
        platform::UniqueFd fd(::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        if (!fd || ::write(fd.get(), kContents, sizeof kContents - 1) < 0) {
          std::perror(file.c_str());
          return false;
        }
      }
    }
  }
  // Nothing left to write back while the removal is timed.
  ::sync();
  return true;
}

void BM_DeathRowSweep(benchmark::State& state) {
  KSTClientConnection& client = KSTClientConnection::sharedClientConnection();
  const std::string deathRow = KSTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  for (auto _ : state) {
    state.PauseTiming();
    if (!buildTree(deathRow)) {
      state.SkipWithError("cannot build the tree");
      break;
    }
    state.ResumeTiming();
    std::promise<std::uint64_t> done;
    client.deleteContainersOnDeathRowWithCompletion(
        [&done](std::uint64_t code) { done.set_value(code); });
    const std::uint64_t code = done.get_future().get();
    if (code != 1) state.SkipWithError("the sweep failed");
  }
  KSTDeathRowQueue()->sync([] {});
}

void BM_RmRf(benchmark::State& state) {
  const std::string tree = fakes().scratch.resolve("/private/var/rm-rf-tree");
  for (auto _ : state) {
    state.PauseTiming();
    if (!buildTree(tree)) {
      state.SkipWithError("cannot build the tree");
      break;
    }
    state.ResumeTiming();
    const char* argv[] = {"rm", "-rf", tree.c_str(), nullptr};
    pid_t pid = -1;
    int status = -1;
    if (::posix_spawnp(&pid, "rm", nullptr, nullptr, const_cast<char**>(argv), environ) != 0 ||
        ::waitpid(pid, &status, 0) != pid || status != 0) {
      state.SkipWithError("rm -rf failed");
    }
  }
}

BENCHMARK(BM_DeathRowSweep)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(1);
BENCHMARK(BM_RmRf)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(1);

// The console output, then the ratio of the two figures (medians when repeated).
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      const bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
      if (run.run_type == Run::RT_Aggregate && !median) continue;
      const std::string name = run.run_name.function_name;
      // A median replaces the single runs it sums up.
      if (median || !medians_.count(name)) times_[name] = run.GetAdjustedRealTime();
      if (median) medians_.insert(name);
    }
  }
  void Finalize() override {
    ConsoleReporter::Finalize();
    auto sweep = times_.find("BM_DeathRowSweep");
    auto rm = times_.find("BM_RmRf");
    if (sweep == times_.end() || rm == times_.end() || rm->second <= 0) return;
    std::printf("\nsweep of %d files: %.1f ms, rm -rf: %.1f ms, ratio %.2fx\n",
                kContainers * kDirectories * kFiles, sweep->second, rm->second,
                sweep->second / rm->second);
  }

 private:
  std::map<std::string, double> times_;
  std::set<std::string> medians_;
};

}  // namespace
}  // namespace kestrel

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  kestrel::fakes();  // the scratch root and services, before the first queue starts
  kestrel::RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return 0;
}
