// File manager against the system tools on the same trees:
//   removal of a 10k-file tree      vs rm -rf
//   disk usage of a 10k-file tree   vs du -s
//   copy of a 100 MiB tree          vs cp -a
// Each is run several times, alternating, on a fresh tree; the medians and
// their ratio (file manager / tool) are printed. Build in Release to measure.
//
// Usage: fs_bench [work-directory]   (default /var/tmp; pick the file system
// to measure on)

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>
#include <string>
#include <vector>

namespace fs = std::filesystem;
using quarn::QRNFileManager;

namespace {

constexpr int kRuns = 5;

double seconds(const std::function<void()>& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

// 100 directories of 100 small files.
void makeManySmallFiles(const fs::path& top) {
    for (int d = 0; d < 100; ++d) {
        auto sub = top / fmt::format("d{}", d);
        fs::create_directories(sub);
        for (int f = 0; f < 100; ++f) {
            std::ofstream(sub / fmt::format("f{}", f)) << "content " << f << '\n';
        }
    }
}

// 10 directories of 10 files of 1 MiB (random, so nothing compresses).
void makeHundredMiB(const fs::path& top) {
    std::mt19937_64 gen(7);
    std::vector<std::uint64_t> block((1 << 20) / sizeof(std::uint64_t));
    for (int d = 0; d < 10; ++d) {
        auto sub = top / fmt::format("d{}", d);
        fs::create_directories(sub);
        for (int f = 0; f < 10; ++f) {
            for (auto& word : block) {
                word = gen();
            }
            std::ofstream out(sub / fmt::format("f{}", f), std::ios::binary);
            out.write(reinterpret_cast<const char*>(block.data()),
                      static_cast<std::streamsize>(block.size() * sizeof(block[0])));
        }
    }
}

void run(const std::string& command) {
    if (std::system(command.c_str()) != 0) {
        std::fprintf(stderr, "failed: %s\n", command.c_str());
        std::exit(1);
    }
}

void check(bool ok, const char* what) {
    if (!ok) {
        std::fprintf(stderr, "failed: %s\n", what);
        std::exit(1);
    }
}

void report(const char* what, const std::vector<double>& ours, const std::vector<double>& tool,
            const char* toolName) {
    double a = median(ours);
    double b = median(tool);
    std::printf("%-28s file manager %8.2f ms   %-7s %8.2f ms   ratio %.2f\n", what, a * 1e3,
                toolName, b * 1e3, a / b);
}

void benchRemoval(QRNFileManager& manager, const fs::path& work) {
    std::vector<double> ours;
    std::vector<double> tool;
    auto tree = work / "remove";
    for (int i = 0; i < kRuns; ++i) {
        makeManySmallFiles(tree);
        run("sync");
        ours.push_back(
            seconds([&] { check(manager.removeItemAtURL(tree).has_value(), "remove"); }));
        check(!fs::exists(tree), "tree removed");
        makeManySmallFiles(tree);
        run("sync");
        tool.push_back(seconds([&] { run(fmt::format("rm -rf '{}'", tree.string())); }));
    }
    report("remove 10k-file tree", ours, tool, "rm -rf");
}

void benchDiskUsage([[maybe_unused]] QRNFileManager& manager,
                    [[maybe_unused]] const fs::path& work) {
#ifdef QUARN_BENCH_DISK_USAGE
    std::vector<double> ours;
    std::vector<double> tool;
    auto tree = work / "usage";
    makeManySmallFiles(tree);
    for (int i = 0; i < kRuns; ++i) {
        ours.push_back(seconds([&] { check(manager.diskUsageForURL(tree) > 0, "disk usage"); }));
        tool.push_back(seconds([&] { run(fmt::format("du -s '{}' > /dev/null", tree.string())); }));
    }
    check(manager.removeItemAtURL(tree).has_value(), "remove usage tree");
    report("disk usage of 10k-file tree", ours, tool, "du -s");
#else
    std::printf("%-28s not measured: this build has no diskUsageForURL\n", "disk usage");
#endif
}

void benchCopy(QRNFileManager& manager, const fs::path& work) {
    std::vector<double> ours;
    std::vector<double> tool;
    auto src = work / "copy-src";
    auto dst = work / "copy-dst";
    makeHundredMiB(src);
    run("sync");
    for (int i = 0; i < kRuns; ++i) {
        ours.push_back(
            seconds([&] { check(manager.copyItemAtURL(src, dst).has_value(), "copy"); }));
        check(manager.removeItemAtURL(dst).has_value(), "remove copy");
        run("sync");
        tool.push_back(
            seconds([&] { run(fmt::format("cp -a '{}' '{}'", src.string(), dst.string())); }));
        check(manager.removeItemAtURL(dst).has_value(), "remove cp copy");
        run("sync");
    }
    check(manager.removeItemAtURL(src).has_value(), "remove copy source");
    report("copy 100 MiB tree", ours, tool, "cp -a");
}

} // namespace

int main(int argc, char** argv) {
    fs::path base = argc > 1 ? argv[1] : "/var/tmp";
    std::string tmpl = (base / "quarn-fs-bench.XXXXXX").string();
    if (!mkdtemp(tmpl.data())) {
        std::perror("mkdtemp");
        return 1;
    }
    fs::path work = tmpl;
    auto context = std::make_shared<quarn::QRNDaemonContext>("/");
    quarn::installLinuxPlatform(*context);
    quarn::QRNDaemonContext::setCurrent(context);
    QRNFileManager manager(*context);

    std::printf("work directory %s, median of %d runs\n", work.c_str(), kRuns);
    benchRemoval(manager, work);
    benchDiskUsage(manager, work);
    benchCopy(manager, work);

    check(manager.removeItemAtURL(work).has_value(), "remove work directory");
    return 0;
}
