// The container cache on a class directory of 10,000 containers with real
// metadata files, each figure beside a plain-syscall baseline measured in the
// same run:
//   - lookup of one cached container (a map lookup plus one lstat) against a
//     bare lstat of its metadata file;
//   - rebuild of the class map (list the directory, read and check every
//     metadata file) against open/read/close of the same 10,000 files.
// The log is opened at the daemon's default level, so the debug lines of the
// cache cost what they cost in production (nothing is written).
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "daemon/log.h"
#include "platform/unique_fd.h"
#include "store/container_cache.h"
#include "store/global_configuration.h"
#include "store/metadata.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

namespace fs = std::filesystem;

constexpr std::uint32_t kUser = kKSTFirstMobileUserId;
constexpr KSTContainerClass kClass = kKSTContainerClassDataApplication;
// 10,000 containers; KESTREL_BENCH_CONTAINERS=100000 for the large store.
const std::size_t kContainerCount = [] {
  const char* count = std::getenv("KESTREL_BENCH_CONTAINERS");
  return count != nullptr ? std::strtoull(count, nullptr, 10) : std::size_t{10000};
}();

// The process's peak resident set so far, in MiB.
double peakResidentMiB() {
  struct rusage usage {};
  ::getrusage(RUSAGE_SELF, &usage);
  return static_cast<double>(usage.ru_maxrss) / 1024.0;
}

struct Population {
  std::vector<std::string> metadataPaths;
  std::string lookupIdentifier;
  std::string lookupMetadataPath;
};

Population& population() {
  static Population instance;
  return instance;
}

std::string identifierFor(std::size_t index) {
  char buffer[48];
  std::snprintf(buffer, sizeof buffer, "com.example.bench.%06zu", index);
  return buffer;
}

// Makes the containers once: a directory named by a fresh UUID holding the
// metadata file the daemon writes. False (with a message) on any failure.
bool populateClassDirectory() {
  const std::optional<KSTFileURL> classDirectory =
      KSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(kUser, kClass, false);
  if (!classDirectory) {
    std::fprintf(stderr, "no class directory for %u/%llu\n", kUser,
                 static_cast<unsigned long long>(kClass));
    return false;
  }
  Population& p = population();
  p.metadataPaths.reserve(kContainerCount);
  for (std::size_t i = 0; i < kContainerCount; ++i) {
    const KSTFileURL url = classDirectory->appending(platform::Uuid::random().string(), true);
    std::error_code ec;
    fs::create_directories(url.path(), ec);
    if (ec) {
      std::fprintf(stderr, "cannot make %s: %s\n", url.path().c_str(), ec.message().c_str());
      return false;
    }
    auto record = KSTMetadata::initWithUserId(kUser, platform::Uuid::random(), kClass,
                                              identifierFor(i), std::nullopt, url);
    KSTErrorRef error;
    if (!record->writeMetadataToDiskWithError(&error)) {
      std::fprintf(stderr, "cannot write metadata: %s\n", FormatArg(error).description().c_str());
      return false;
    }
    p.metadataPaths.push_back(KSTMetadata::metadataFileURL(url).path());
  }
  const std::size_t middle = kContainerCount / 2;
  p.lookupIdentifier = identifierFor(middle);
  p.lookupMetadataPath = p.metadataPaths[middle];
  return true;
}

void BM_CacheLookup(benchmark::State& state) {
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  const std::string& identifier = population().lookupIdentifier;
  for (auto _ : state) {
    KSTErrorRef error;
    KSTMetadataRef record = cache.containerForUser(kUser, kClass, identifier, false, &error);
    if (!record) {
      state.SkipWithError("lookup failed");
      break;
    }
    benchmark::DoNotOptimize(record);
  }
}

void BM_PlainLstat(benchmark::State& state) {
  const char* path = population().lookupMetadataPath.c_str();
  for (auto _ : state) {
    struct stat info;
    if (::lstat(path, &info) != 0) {
      state.SkipWithError("lstat failed");
      break;
    }
    benchmark::DoNotOptimize(info);
  }
}

void BM_CacheRebuild(benchmark::State& state) {
  KSTContainerCache& cache = KSTContainerCache::sharedInstance();
  for (auto _ : state) {
    state.PauseTiming();
    cache._discardClassMapForUser(kUser, kClass, false);
    state.ResumeTiming();
    KSTErrorRef error;
    auto identifiers = cache.allContainerIdentifiersForUser(kUser, kClass, false, &error);
    if (!identifiers || identifiers->size() != kContainerCount) {
      state.SkipWithError("rebuild did not find every container");
      break;
    }
    benchmark::DoNotOptimize(identifiers);
  }
  state.counters["containers"] = static_cast<double>(kContainerCount);
  state.counters["peak_rss_mib"] = peakResidentMiB();
}

void BM_PlainReadMetadataFiles(benchmark::State& state) {
  const std::vector<std::string>& paths = population().metadataPaths;
  char buffer[4096];
  for (auto _ : state) {
    std::size_t total = 0;
    for (const std::string& path : paths) {
      platform::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
      if (!fd) {
        state.SkipWithError("open failed");
        return;
      }
      ssize_t n;
      while ((n = ::read(fd.get(), buffer, sizeof buffer)) > 0)
        total += static_cast<std::size_t>(n);
      if (n < 0) {
        state.SkipWithError("read failed");
        return;
      }
    }
    benchmark::DoNotOptimize(total);
  }
  state.counters["containers"] = static_cast<double>(paths.size());
}

BENCHMARK(BM_CacheLookup);
BENCHMARK(BM_PlainLstat);
BENCHMARK(BM_CacheRebuild)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_PlainReadMetadataFiles)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace kestrel

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  // One scratch root and one set of fakes for the whole run: the layout and
  // the cache are process-wide singletons that keep the paths they first saw.
  kestrel::testing::FakeServices fakes;
  kestrel::Log::open("com.zorvane.kestreld", fakes.scratch.path() + "/log", kestrel::kLogNotice);
  if (!kestrel::populateClassDirectory()) return 1;
  std::printf("peak resident set after making %zu containers: %.1f MiB\n", kestrel::kContainerCount,
              kestrel::peakResidentMiB());
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
