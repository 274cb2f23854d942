#include "RatioReporter.h"

#include <unistd.h>

#include <cstdio>
#include <utility>

namespace quarn::bench {

namespace {

// Each operation and the floor it is compared with (same time unit).
const std::pair<const char*, const char*> kPairs[] = {
    {"BM_IdentifierReadLock", "BM_Floor_SharedMutexRead"},
    {"BM_IdentifierReadLock/real_time/threads:4", "BM_Floor_SharedMutexRead/real_time/threads:4"},
    {"BM_IdentifierWriteLock", "BM_Floor_SharedMutexWrite"},
    {"BM_IdentifierWriteLock/real_time/threads:4", "BM_Floor_SharedMutexWrite/real_time/threads:4"},
    {"BM_GlobalReadLock", "BM_Floor_SharedMutexRead"},
    {"BM_GlobalWriteLock", "BM_Floor_SharedMutexWrite"},
    {"BM_CacheLookup", "BM_Floor_MapLookup"},
    {"BM_CacheLookup/real_time/threads:4", "BM_Floor_MapLookup/real_time/threads:4"},
    {"BM_MetadataWrite", "BM_Floor_MetadataWrite"},
    {"BM_MetadataReadAndValidate", "BM_Floor_MetadataRead"},
    {"BM_CborEncodeReply", "BM_Floor_CborSerializeReply"},
    {"BM_CborDecodeReply", "BM_Floor_CborLoadReply"},
    {"BM_PlistEncodeMetadata", "BM_Floor_PlistToBin"},
    {"BM_PlistDecodeMetadata", "BM_Floor_PlistFromBin"},
};

} // namespace

RatioReporter::RatioReporter()
    : ConsoleReporter(::isatty(STDOUT_FILENO) ? OO_Defaults : OO_Tabular) {}

void RatioReporter::ReportRuns(const std::vector<Run>& reports) {
    ConsoleReporter::ReportRuns(reports);
    for (const auto& run : reports) {
        if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
            realTimes_[run.benchmark_name()] = run.GetAdjustedRealTime();
        }
    }
}

void RatioReporter::Finalize() {
    ConsoleReporter::Finalize();
    std::printf("\n%-44s %-46s %7s\n", "operation", "floor", "ratio");
    for (const auto& [operation, floor] : kPairs) {
        auto ours = realTimes_.find(operation);
        auto bare = realTimes_.find(floor);
        if (ours == realTimes_.end() || bare == realTimes_.end() || bare->second <= 0) {
            continue; // filtered out, or not built (the wire format)
        }
        std::printf("%-44s %-46s %7.2f\n", operation, floor, ours->second / bare->second);
    }
}

} // namespace quarn::bench
