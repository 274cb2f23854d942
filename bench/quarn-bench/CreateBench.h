#pragma once
// Creation of new app data containers through the daemon (command 0,
// creation on, one client), against the bare system calls of the same work
// done by this tool on the same file system: make the staging directory and
// the class's subdirectories with their modes, write a metadata file of the
// same size, rename the directory into place. Beside it, the same calls
// plus an owner and a protection class attribute on every item.

#include "BenchOptions.h"
#include "DaemonRunner.h"
#include "LatencySamples.h"
#include "LoadRoot.h"
#include "ResultTable.h"

#include <cstdint>
#include <filesystem>
#include <vector>

namespace quarn::loadbench {

class CreateBench {
public:
    CreateBench(const BenchOptions& options, DaemonRunner& daemon, LoadRoot& root);
    void run(ResultTable& table);

private:
    struct Totals {
        double seconds = 0; // wall-clock time
        double cpu = 0;     // CPU time of the side doing the work
    };
    void createWithDaemon(int count, LatencySamples& samples, Totals& totals);
    // `ownerAndClass` also gives every item the owner and the protection
    // class attribute, as the daemon must: a second, informative floor.
    void createBare(int count, bool ownerAndClass, LatencySamples& samples, Totals& totals);
    void createOneBare(const std::filesystem::path& name, bool ownerAndClass) const;

    const BenchOptions& options_;
    DaemonRunner& daemon_;
    std::filesystem::path staging_;
    std::filesystem::path live_;
    std::vector<std::uint8_t> metadata_;
    int made_ = 0;
};

} // namespace quarn::loadbench
