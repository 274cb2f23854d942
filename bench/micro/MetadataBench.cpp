// The metadata file of one container: writing it (temporary file in the
// staging directory, moved over the old one) and reading and validating it,
// against the bare system calls of the same I/O on the same bytes (floor).

#include "BenchRoot.h"

#include "Daemon/support/PropertyList.h"

#include <benchmark/benchmark.h>
#include <plist/plist.h>

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <vector>

namespace {

using namespace quarn;

struct MetadataFixture {
    QRNMetadataPtr metadata;
    std::filesystem::path file;
    std::vector<std::uint8_t> bytes;

    MetadataFixture() {
        metadata = bench::BenchRoot::shared().makeContainer(2, "com.example.bench.metadata");
        file = metadata->url() / QRNMetadata::kFileName;
        bytes = *binaryPropertyList(metadata->dictionary());
    }

    static MetadataFixture& shared() {
        static MetadataFixture fixture;
        return fixture;
    }
};

void fail(const char* what) {
    std::perror(what);
    std::exit(1);
}

void BM_MetadataWrite(benchmark::State& state) {
    auto& fixture = MetadataFixture::shared();
    for (auto _ : state) {
        if (!fixture.metadata->writeMetadataToFileURL(fixture.file)) {
            fail("metadata write");
        }
    }
}
BENCHMARK(BM_MetadataWrite);

void BM_MetadataReadAndValidate(benchmark::State& state) {
    auto& fixture = MetadataFixture::shared();
    auto user = bench::BenchRoot::shared().mobile();
    for (auto _ : state) {
        auto read = QRNMetadata::readAndValidateMetadataAtFileUrl(fixture.file, user, true);
        if (!read) {
            fail("metadata read");
        }
        benchmark::DoNotOptimize(read);
    }
}
BENCHMARK(BM_MetadataReadAndValidate);

// Floor of the write: create, write and close a temporary file beside the
// final one, rename it over.
void BM_Floor_MetadataWrite(benchmark::State& state) {
    auto& fixture = MetadataFixture::shared();
    const auto temporary = fixture.file.parent_path() / "floor-temp.plist";
    for (auto _ : state) {
        int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd < 0 || ::write(fd, fixture.bytes.data(), fixture.bytes.size()) < 0 ||
            ::close(fd) != 0 || ::rename(temporary.c_str(), fixture.file.c_str()) != 0) {
            fail("floor write");
        }
    }
}
BENCHMARK(BM_Floor_MetadataWrite);

// Floor of the read: open, read, close, parse with the library.
void BM_Floor_MetadataRead(benchmark::State& state) {
    auto& fixture = MetadataFixture::shared();
    std::vector<char> buffer(64 * 1024);
    for (auto _ : state) {
        int fd = ::open(fixture.file.c_str(), O_RDONLY | O_CLOEXEC);
        ssize_t n = fd < 0 ? -1 : ::read(fd, buffer.data(), buffer.size());
        if (n <= 0 || ::close(fd) != 0) {
            fail("floor read");
        }
        plist_t node = nullptr;
        plist_from_bin(buffer.data(), static_cast<std::uint32_t>(n), &node);
        benchmark::DoNotOptimize(node);
        plist_free(node);
    }
}
BENCHMARK(BM_Floor_MetadataRead);

} // namespace
