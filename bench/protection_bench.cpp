// Moving a data container of 10,000 and of 100,000 files from class 3 to
// class 1 (command 21's operation, from the request to its completion)
// against a bare fts walk over the same tree that opens each item as the
// operation does, reads its class attribute and sets it, measured in the
// same run. Before each timed run every item is put back into class 3,
// outside the timing. The peak resident set of each run is reported beside
// its time (VmHWM, reset before the run), to show that the walk's memory
// does not grow with the number of files.
//
// Needs root (trusted.* attributes; the scratch root chowns):
//   build/bench/bench/kestrel_protection_bench    (or bench/run.sh --benchmark_filter=Protection)
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <fts.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "daemon/log.h"
#include "platform/data_protection.h"
#include "platform/linux/key_bag_linux.h"
#include "platform/unique_fd.h"
#include "protection/data_protection_manager.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr const char* kIdentifier = "com.example.bench";
constexpr int kFilesPerDirectory = 100;
constexpr int kTopDirectories = 10;

testing::FakeServices& fakes() {
  static testing::FakeServices instance;
  return instance;
}

KSTClientConnection& installer() {
  static KSTClientConnection client(std::string("com.example.installer"), 0, true, std::nullopt);
  return client;
}

// The container of the given size, built once: Documents/aNN/bNNN/fNN, 100
// files a directory, spread over ten directories at the top.
KSTMetadataRef container(int files) {
  static std::map<int, KSTMetadataRef> made;
  if (auto found = made.find(files); found != made.end()) return found->second;
  std::uint64_t code = 1;
  KSTMetadataRef metadata = installer().createOrLookupContainerForUser(
      501, std::string(kIdentifier) + "." + std::to_string(files), true, 2, false, true, &code);
  if (!metadata) return nullptr;
  static const char kContents[] = "a small file, as most in a container are\n";
  const int directories = files / kFilesPerDirectory;
  for (int d = 0; d < directories; ++d) {
    const std::string directory = metadata->url().path() + "/Documents/a" +
                                  std::to_string(d % kTopDirectories) + "/b" + std::to_string(d);
    fs::create_directories(directory);
    for (int f = 0; f < kFilesPerDirectory; ++f) {
      const std::string file = directory + "/f" + std::to_string(f);
      platform::UniqueFd fd(::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
      if (!fd || ::write(fd.get(), kContents, sizeof kContents - 1) < 0) return nullptr;
    }
  }
  ::sync();
  return made[files] = metadata;
}

// Calls the function with each item the operation changes (directories after
// their contents, regular files), as fts_path.
template <typename Visit>
bool walk(const std::string& root, Visit visit) {
  char* paths[] = {const_cast<char*>(root.c_str()), nullptr};
  FTS* fts = ::fts_open(paths, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
  if (fts == nullptr) return false;
  bool ok = true;
  while (FTSENT* entry = ::fts_read(fts)) {
    if (entry->fts_info == FTS_DP || entry->fts_info == FTS_F) ok = visit(entry->fts_path) && ok;
  }
  ::fts_close(fts);
  return ok;
}

// The bare walk's work on one item: open it as the operation does, read the
// class and set it when it differs.
bool setClassOfItem(const char* path, std::int32_t protectionClass) {
  const int fd = ::open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) return false;
  std::array<unsigned char, 4> bytes{};
  const ssize_t got =
      ::fgetxattr(fd, platform::kProtectionClassAttribute, bytes.data(), bytes.size());
  std::int32_t current = 0;
  std::memcpy(&current, bytes.data(), sizeof current);
  bool ok = true;
  if (got != 4 || current != protectionClass) {
    std::memcpy(bytes.data(), &protectionClass, sizeof protectionClass);
    ok = ::fsetxattr(fd, platform::kProtectionClassAttribute, bytes.data(), bytes.size(), 0) == 0;
  }
  ::close(fd);
  return ok;
}

// Every item in class 3 and the container recording 3, outside the timing.
bool reset(const KSTMetadataRef& metadata) {
  std::uint64_t code = 1;
  installer().setInfoValue(PlistValue(std::int64_t{3}), kKSTContentProtectionClassInfoKey, 501,
                           metadata->uuid(), metadata->identifier(), 2, true, &code);
  return code == 1 && walk(metadata->url().path() + "/Documents",
                           [](const char* path) { return setClassOfItem(path, 3); });
}

// VmHWM of this process in KiB, after resetting it to the current size (when asked).
long peakResidentKiB() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmHWM:", 0) == 0) return std::stol(line.substr(6));
  }
  return -1;
}
void resetPeakResident() {
  std::ofstream("/proc/self/clear_refs") << "5";
}

template <typename Run>
void measure(benchmark::State& state, Run run) {
  const KSTMetadataRef metadata = container(static_cast<int>(state.range(0)));
  if (!metadata) {
    state.SkipWithError("cannot build the container");
    return;
  }
  long peak = 0;
  for (auto _ : state) {
    state.PauseTiming();
    if (!reset(metadata)) {
      state.SkipWithError("cannot reset the classes");
      break;
    }
    resetPeakResident();
    state.ResumeTiming();
    if (!run(metadata)) state.SkipWithError("the change failed");
    state.PauseTiming();
    peak = std::max(peak, peakResidentKiB());
    state.ResumeTiming();
  }
  state.counters["peak_rss_MiB"] = static_cast<double>(peak) / 1024;
}

void BM_ProtectionChange(benchmark::State& state) {
  measure(state, [](const KSTMetadataRef& metadata) {
    std::promise<std::uint64_t> done;
    KSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
        501, metadata->identifier(), 2, 1, true, false,
        [&done](std::uint64_t code) { done.set_value(code); });
    return done.get_future().get() == 1;
  });
}

void BM_BareXattrWalk(benchmark::State& state) {
  measure(state, [](const KSTMetadataRef& metadata) {
    return walk(metadata->url().path() + "/Documents",
                [](const char* path) { return setClassOfItem(path, 1); });
  });
}

BENCHMARK(BM_ProtectionChange)
    ->Arg(10000)
    ->Arg(100000)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Iterations(1);
BENCHMARK(BM_BareXattrWalk)
    ->Arg(10000)
    ->Arg(100000)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Iterations(1);

// The console output, then per size the ratio of the two figures (medians
// when repeated) and the peak resident sets.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      const bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
      if (run.run_type == Run::RT_Aggregate && !median) continue;
      const std::string name = run.run_name.function_name + "/" + run.run_name.args;
      if (median || !medians_.count(name)) {
        times_[name] = run.GetAdjustedRealTime();
        const auto rss = run.counters.find("peak_rss_MiB");
        if (rss != run.counters.end()) rss_[name] = rss->second.value;
      }
      if (median) medians_.insert(name);
    }
  }
  void Finalize() override {
    ConsoleReporter::Finalize();
    for (const char* size : {"10000", "100000"}) {
      const std::string change = std::string("BM_ProtectionChange/") + size;
      const std::string bare = std::string("BM_BareXattrWalk/") + size;
      if (!times_.count(change) || !times_.count(bare) || times_[bare] <= 0) continue;
      std::printf(
          "%s files: change %.1f ms (peak RSS %.1f MiB), bare walk %.1f ms (%.1f MiB), "
          "ratio %.2fx\n",
          size, times_[change], rss_[change], times_[bare], rss_[bare],
          times_[change] / times_[bare]);
    }
  }

 private:
  std::map<std::string, double> times_;
  std::map<std::string, double> rss_;
  std::set<std::string> medians_;
};

}  // namespace
}  // namespace kestrel

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  // The scratch root and services, before the first queue starts; the key
  // bag and the log level as the daemon has them (debug lines not written).
  kestrel::testing::FakeServices& fakes = kestrel::fakes();
  fakes.services.keyBag = std::make_shared<kestrel::platform::LinuxKeyBag>(fakes.scratch.root());
  fakes.install();
  kestrel::Log::open("com.zorvane.kestreld", "/dev/null", kestrel::kLogNotice);
  kestrel::KSTCreateWorkQueues();
  kestrel::RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return 0;
}
