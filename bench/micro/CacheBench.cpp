// Container cache lookups of a built entry of 1000 app data containers, as
// the lookup fast path asks (sandbox mapping kept, kernel read-back allowed),
// against a bare map lookup under a mutex (the floor).

#include "BenchRoot.h"

#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerIdentity.h"

#include <benchmark/benchmark.h>

#include <malloc.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace {

using namespace quarn;

constexpr std::uint64_t kAppDataClass = 2;
constexpr int kContainers = 1000;

std::string identifierAt(int i) {
    return "com.example.bench.cache" + std::to_string(i);
}

// Made once per run: the containers on disk and the entry built.
struct CacheFixture {
    std::vector<QRNContainerIdentityPtr> identities;

    CacheFixture() {
        auto& root = bench::BenchRoot::shared();
        for (int i = 0; i < kContainers; ++i) {
            root.makeContainer(kAppDataClass, identifierAt(i));
            identities.push_back(*QRNContainerIdentity::containerIdentityWithUserIdentity(
                root.mobile(), identifierAt(i), kAppDataClass));
        }
        auto first = QRNContainerCache::sharedInstance().containerForContainerIdentity(
            identities.front(), false, true, true);
        if (!first) {
            std::fprintf(stderr, "cache lookup failed\n");
            std::exit(1);
        }
    }

    static CacheFixture& shared() {
        static CacheFixture fixture;
        return fixture;
    }
};

void BM_CacheLookup(benchmark::State& state) {
    auto& fixture = CacheFixture::shared();
    auto& cache = QRNContainerCache::sharedInstance();
    std::size_t i = static_cast<std::size_t>(state.thread_index()) * 97;
    for (auto _ : state) {
        auto found = cache.containerForContainerIdentity(
            fixture.identities[i++ % fixture.identities.size()], false, true, true);
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_CacheLookup);
BENCHMARK(BM_CacheLookup)->Threads(4)->UseRealTime();

// Building the identity is part of every lookup request.
void BM_CacheLookupWithIdentity(benchmark::State& state) {
    auto& fixture = CacheFixture::shared();
    auto& cache = QRNContainerCache::sharedInstance();
    auto user = bench::BenchRoot::shared().mobile();
    const std::string identifier = fixture.identities[kContainers / 2]->identifier();
    for (auto _ : state) {
        auto identity = QRNContainerIdentity::containerIdentityWithUserIdentity(user, identifier,
                                                                                kAppDataClass);
        auto found = cache.containerForContainerIdentity(*identity, false, true, true);
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_CacheLookupWithIdentity);

// Heap held per cached container (all threads' arenas), as a counter:
// the entry of a class directory of 5000 containers, built once.
void BM_CacheHeapPerContainer(benchmark::State& state) {
    constexpr int kMany = 5000;
    constexpr std::uint64_t kPluginDataClass = 4;
    auto& root = bench::BenchRoot::shared();
    for (int i = 0; i < kMany; ++i) {
        root.makeContainer(kPluginDataClass, "com.example.bench.heap" + std::to_string(i));
    }
    auto identity = *QRNContainerIdentity::containerIdentityWithUserIdentity(
        root.mobile(), "com.example.bench.heap0", kPluginDataClass);
    double perContainer = 0;
    for (auto _ : state) {
        const auto before = mallinfo2().uordblks;
        auto found = QRNContainerCache::sharedInstance().containerForContainerIdentity(
            identity, false, true, true);
        benchmark::DoNotOptimize(found);
        perContainer = static_cast<double>(mallinfo2().uordblks - before) / kMany;
    }
    state.counters["heap_B_per_container"] = perContainer;
}
BENCHMARK(BM_CacheHeapPerContainer)->Iterations(1);

// Floor: the same number of shared records in an ordered map under a mutex.
void BM_Floor_MapLookup(benchmark::State& state) {
    static std::mutex mutex;
    static const auto map = [] {
        std::map<std::string, std::shared_ptr<const int>, std::less<>> m;
        for (int i = 0; i < kContainers; ++i) {
            m.emplace(identifierAt(i), std::make_shared<const int>(i));
        }
        return m;
    }();
    std::vector<std::string> keys;
    for (int i = 0; i < kContainers; ++i) {
        keys.push_back(identifierAt(i));
    }
    std::size_t i = static_cast<std::size_t>(state.thread_index()) * 97;
    for (auto _ : state) {
        std::shared_ptr<const int> found;
        {
            std::lock_guard guard(mutex);
            found = map.find(keys[i++ % keys.size()])->second;
        }
        benchmark::DoNotOptimize(found);
    }
}
BENCHMARK(BM_Floor_MapLookup);
BENCHMARK(BM_Floor_MapLookup)->Threads(4)->UseRealTime();

} // namespace
