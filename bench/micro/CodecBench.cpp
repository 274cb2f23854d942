// Value <-> CBOR (the wire format) for a lookup request and its reply, and
// Value <-> binary property list for a metadata dictionary. The floors are
// the libraries' own calls on the same data, so the ratio is the cost of the
// conversion and the hostile-input checks around them.

#include "BenchRoot.h"

#include "Daemon/support/PropertyList.h"

#include <benchmark/benchmark.h>
#include <cbor.h>
#include <plist/plist.h>

#include <cstdio>
#include <cstdlib>
#include <vector>

#ifdef QUARN_BENCH_CBOR
#include "Daemon/platform/CborCodec.h"
#endif

namespace {

using namespace quarn;

Value lookupRequest() {
    return Value(Value::Dictionary{{"Command", Value(0u)},
                                   {"Identifier", Value("com.example.bench.app")},
                                   {"ContainerClass", Value(2u)},
                                   {"CreateIfNecessary", Value(false)},
                                   {"Transient", Value(false)}});
}

Value lookupReply() {
    const UUID uuid = UUID::random();
    return Value(Value::Dictionary{
        {"ReplyError", Value(1u)},
        {"ReplyUUID", Value(uuid)},
        {"ReplyExisted", Value(true)},
        {"ReplyPath", Value("/private/var/mobile/Containers/Data/Application/" + uuid.string())},
        {"ReplyIdentifier", Value("com.example.bench.app")}});
}

Value metadataDictionary() {
    static const Value dict =
        bench::BenchRoot::shared().makeContainer(2, "com.example.bench.codec")->dictionary();
    return dict;
}

#ifdef QUARN_BENCH_CBOR
void BM_CborEncodeRequest(benchmark::State& state) {
    const Value request = lookupRequest();
    for (auto _ : state) {
        benchmark::DoNotOptimize(CborCodec::encode(request));
    }
}
BENCHMARK(BM_CborEncodeRequest);

void BM_CborEncodeReply(benchmark::State& state) {
    const Value reply = lookupReply();
    for (auto _ : state) {
        benchmark::DoNotOptimize(CborCodec::encode(reply));
    }
}
BENCHMARK(BM_CborEncodeReply);

void BM_CborDecodeRequest(benchmark::State& state) {
    const auto bytes = CborCodec::encode(lookupRequest());
    for (auto _ : state) {
        benchmark::DoNotOptimize(CborCodec::decode(bytes));
    }
}
BENCHMARK(BM_CborDecodeRequest);

void BM_CborDecodeReply(benchmark::State& state) {
    const auto bytes = CborCodec::encode(lookupReply());
    for (auto _ : state) {
        benchmark::DoNotOptimize(CborCodec::decode(bytes));
    }
}
BENCHMARK(BM_CborDecodeReply);

// Floors: libcbor loading the same bytes into its own items, and
// serialising those items back.
void BM_Floor_CborLoadReply(benchmark::State& state) {
    const auto bytes = CborCodec::encode(lookupReply());
    for (auto _ : state) {
        cbor_load_result result;
        cbor_item_t* item = cbor_load(bytes.data(), bytes.size(), &result);
        benchmark::DoNotOptimize(item);
        cbor_decref(&item);
    }
}
BENCHMARK(BM_Floor_CborLoadReply);

void BM_Floor_CborSerializeReply(benchmark::State& state) {
    const auto bytes = CborCodec::encode(lookupReply());
    cbor_load_result result;
    cbor_item_t* item = cbor_load(bytes.data(), bytes.size(), &result);
    for (auto _ : state) {
        unsigned char* buffer = nullptr;
        std::size_t size = 0;
        benchmark::DoNotOptimize(cbor_serialize_alloc(item, &buffer, &size));
        std::free(buffer);
    }
    cbor_decref(&item);
}
BENCHMARK(BM_Floor_CborSerializeReply);
#endif

void BM_PlistEncodeMetadata(benchmark::State& state) {
    const Value dict = metadataDictionary();
    for (auto _ : state) {
        benchmark::DoNotOptimize(binaryPropertyList(dict));
    }
}
BENCHMARK(BM_PlistEncodeMetadata);

void BM_PlistDecodeMetadata(benchmark::State& state) {
    const auto bytes = *binaryPropertyList(metadataDictionary());
    for (auto _ : state) {
        benchmark::DoNotOptimize(valueFromPropertyListBytes(bytes));
    }
}
BENCHMARK(BM_PlistDecodeMetadata);

// Floors: libplist parsing the same bytes into its nodes, and writing those
// nodes back.
void BM_Floor_PlistFromBin(benchmark::State& state) {
    const auto bytes = *binaryPropertyList(metadataDictionary());
    for (auto _ : state) {
        plist_t node = nullptr;
        plist_from_bin(reinterpret_cast<const char*>(bytes.data()),
                       static_cast<std::uint32_t>(bytes.size()), &node);
        benchmark::DoNotOptimize(node);
        plist_free(node);
    }
}
BENCHMARK(BM_Floor_PlistFromBin);

void BM_Floor_PlistToBin(benchmark::State& state) {
    auto converted = propertyListFromValue(metadataDictionary());
    PropertyListPtr node = std::move(converted.value());
    for (auto _ : state) {
        char* buffer = nullptr;
        std::uint32_t size = 0;
        plist_to_bin(node.get(), &buffer, &size);
        benchmark::DoNotOptimize(buffer);
        plist_to_bin_free(buffer);
    }
}
BENCHMARK(BM_Floor_PlistToBin);

} // namespace
