// Identifier locks against a bare std::shared_mutex, lock and unlock in a loop,
// for writing and for reading, by one thread and by two threads on the same
// identifier. Both sides use wall-clock time so that their ratio means
// something with two threads. A third side, the design's floor, does only the
// synchronisation a lock and unlock of one identifier cannot do without. The
// log is opened at the daemon's default level, as in production: the debug
// lines of the locks are then skipped unformatted.
#include <benchmark/benchmark.h>

#include <pthread.h>

#include <atomic>
#include <mutex>
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
// without, nothing else: the state mutex taken twice (once to find the record
// and count the locker, once to release), the record's reader/writer lock, and
// the record's lock state changed atomically on the way in and out.
struct DesignFloor {
  std::mutex state;
  pthread_rwlock_t record = PTHREAD_RWLOCK_INITIALIZER;
  std::atomic<std::int32_t> lockState{0};
};
DesignFloor gFloor;

void BM_DesignFloorWriting(benchmark::State& state) {
  for (auto _ : state) {
    gFloor.state.lock();
    gFloor.state.unlock();
    pthread_rwlock_wrlock(&gFloor.record);
    std::int32_t expected = 0;
    gFloor.lockState.compare_exchange_strong(expected, -1);
    gFloor.state.lock();
    expected = -1;
    gFloor.lockState.compare_exchange_strong(expected, 0);
    pthread_rwlock_unlock(&gFloor.record);
    gFloor.state.unlock();
  }
}

void BM_DesignFloorReading(benchmark::State& state) {
  for (auto _ : state) {
    gFloor.state.lock();
    gFloor.state.unlock();
    pthread_rwlock_rdlock(&gFloor.record);
    gFloor.lockState.fetch_add(1);
    gFloor.state.lock();
    gFloor.lockState.fetch_sub(1);
    pthread_rwlock_unlock(&gFloor.record);
    gFloor.state.unlock();
  }
}

BENCHMARK(BM_DesignFloorWriting)->UseRealTime()->Threads(1);
BENCHMARK(BM_DesignFloorReading)->UseRealTime()->Threads(1);
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
