#pragma once
// Rebuilding the cache of a class directory of N containers: the daemon is
// started anew and the first lookup in the class (which builds the entry)
// is timed, against this tool listing the same directory and reading and
// parsing the same N metadata files with the bare calls. Then the resident
// memory each cached container costs: the daemon's RSS after a class of M
// containers is cached, minus its RSS after an empty class is.

#include "BenchOptions.h"
#include "DaemonRunner.h"
#include "LoadRoot.h"
#include "ResultTable.h"

#include <cstdint>
#include <filesystem>

namespace quarn::loadbench {

class RebuildBench {
public:
    RebuildBench(const BenchOptions& options, DaemonRunner& daemon);
    void runRebuild(ResultTable& table);
    void runMemory(ResultTable& table);

private:
    struct Timing {
        double seconds = 0; // wall-clock
        double cpu = 0;     // CPU time of the side doing the work
    };
    // The first lookup of a container of the class.
    Timing firstLookup(std::uint64_t containerClass, const std::string& identifier,
                       std::uint64_t expectedError) const;
    // Listing the directory and reading and parsing every metadata file.
    static Timing readAndParseAll(const std::filesystem::path& classDirectory, int expected);

    const BenchOptions& options_;
    DaemonRunner& daemon_;
};

} // namespace quarn::loadbench
