// Identifier locks against a bare std::shared_mutex, lock and unlock in a loop,
// for writing and for reading, by one thread and by two threads on the same
// identifier. Both sides use wall-clock time so that their ratio means
// something with two threads. A third side, the design's floor, does only the
// synchronisation a lock and unlock of one identifier cannot do without. The
// log is opened at the daemon's default level, as in production: the debug
// lines of the locks are then skipped unformatted.
#include <benchmark/benchmark.h>

#include <atomic>
#include <cstdint>
#include <shared_mutex>
#include <string>

#include "daemon/locks.h"
#include "daemon/log.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

const std::string kIdentifier = "5C0B7E0A-3D5A-4C41-9D0E-6A1F2B3C4D5E";

void BM_IdentifierLockWriting(benchmark::State& state) {
  for (auto _ : state) {
    _lock_identifier(kIdentifier, kKSTLockForWriting);
    unlock_identifier(kIdentifier);
  }
}

void BM_IdentifierLockReading(benchmark::State& state) {
  for (auto _ : state) {
    _lock_identifier(kIdentifier, kKSTLockForReading);
    unlock_identifier(kIdentifier);
  }
}

std::shared_mutex gBaseline;

void BM_SharedMutexWriting(benchmark::State& state) {
  for (auto _ : state) {
    gBaseline.lock();
    gBaseline.unlock();
  }
}

void BM_SharedMutexReading(benchmark::State& state) {
  for (auto _ : state) {
    gBaseline.lock_shared();
    gBaseline.unlock_shared();
  }
}

// The synchronisation that a lock and unlock of one identifier cannot do
// without, nothing else: the state mutex taken and released twice (once to
// find the record and take it, once to release it), one atomic instruction
// each way. The same for writing and reading.
std::atomic<std::uint32_t> gFloor{0};

void BM_DesignFloor(benchmark::State& state) {
  for (auto _ : state) {
    for (int pass = 0; pass < 2; ++pass) {
      std::uint32_t expected = 0;
      gFloor.compare_exchange_strong(expected, 1, std::memory_order_acquire);
      benchmark::ClobberMemory();
      gFloor.exchange(0);
    }
  }
}

BENCHMARK(BM_DesignFloor)->UseRealTime()->Threads(1);
BENCHMARK(BM_IdentifierLockWriting)->UseRealTime()->Threads(1)->Threads(2);
BENCHMARK(BM_SharedMutexWriting)->UseRealTime()->Threads(1)->Threads(2);
BENCHMARK(BM_IdentifierLockReading)->UseRealTime()->Threads(1)->Threads(2);
BENCHMARK(BM_SharedMutexReading)->UseRealTime()->Threads(1)->Threads(2);

}  // namespace
}  // namespace kestrel

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  kestrel::testing::FakeServices fakes;
  kestrel::Log::open("com.zorvane.kestreld", fakes.scratch.path() + "/log", kestrel::kLogNotice);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
