// Identifier locks, uncontended and with four threads, against the bare
// std::shared_mutex that each identifier's record wraps (the floor).

#include "Daemon/operations/QRNLocks.h"

#include <benchmark/benchmark.h>

#include <shared_mutex>
#include <string>

namespace {

using quarn::QRNLocks;
using quarn::Value;

// One instance per benchmark run, shared by its threads.
QRNLocks& locks() {
    static QRNLocks* instance = new QRNLocks();
    return *instance;
}

const Value kIdentifier("com.example.bench.app");

void BM_IdentifierReadLock(benchmark::State& state) {
    for (auto _ : state) {
        locks().read_lock_identifier(kIdentifier);
        locks().unlock_identifier(kIdentifier);
    }
}
BENCHMARK(BM_IdentifierReadLock);
BENCHMARK(BM_IdentifierReadLock)->Threads(4)->UseRealTime();

void BM_IdentifierWriteLock(benchmark::State& state) {
    for (auto _ : state) {
        locks().write_lock_identifier(kIdentifier);
        locks().unlock_identifier(kIdentifier);
    }
}
BENCHMARK(BM_IdentifierWriteLock);
BENCHMARK(BM_IdentifierWriteLock)->Threads(4)->UseRealTime();

// Four threads on four identifiers: only the module's own mutex is shared.
void BM_DistinctIdentifierWriteLock(benchmark::State& state) {
    const Value identifier("com.example.bench.app" + std::to_string(state.thread_index()));
    for (auto _ : state) {
        locks().write_lock_identifier(identifier);
        locks().unlock_identifier(identifier);
    }
}
BENCHMARK(BM_DistinctIdentifierWriteLock)->Threads(4)->UseRealTime();

// An array of identifiers, as multi-container operations lock them.
void BM_IdentifierArrayWriteLock(benchmark::State& state) {
    const Value identifiers(Value::Array{"com.example.c", "com.example.a", "com.example.b"});
    for (auto _ : state) {
        locks().write_lock_identifier(identifiers);
        locks().unlock_identifier(identifiers);
    }
}
BENCHMARK(BM_IdentifierArrayWriteLock);

// What every lookup takes.
void BM_GlobalReadLock(benchmark::State& state) {
    for (auto _ : state) {
        locks().read_lock_all_identifiers();
        locks().unlock_all_identifiers();
    }
}
BENCHMARK(BM_GlobalReadLock);
BENCHMARK(BM_GlobalReadLock)->Threads(4)->UseRealTime();

// What every create takes.
void BM_GlobalWriteLock(benchmark::State& state) {
    for (auto _ : state) {
        locks().write_lock_all_identifiers();
        locks().unlock_all_identifiers();
    }
}
BENCHMARK(BM_GlobalWriteLock);
BENCHMARK(BM_GlobalWriteLock)->Threads(4)->UseRealTime();

// Floor: the reader/writer lock alone.
std::shared_mutex gFloorMutex;

void BM_Floor_SharedMutexRead(benchmark::State& state) {
    for (auto _ : state) {
        gFloorMutex.lock_shared();
        gFloorMutex.unlock_shared();
    }
}
BENCHMARK(BM_Floor_SharedMutexRead);
BENCHMARK(BM_Floor_SharedMutexRead)->Threads(4)->UseRealTime();

void BM_Floor_SharedMutexWrite(benchmark::State& state) {
    for (auto _ : state) {
        gFloorMutex.lock();
        gFloorMutex.unlock();
    }
}
BENCHMARK(BM_Floor_SharedMutexWrite);
BENCHMARK(BM_Floor_SharedMutexWrite)->Threads(4)->UseRealTime();

} // namespace
