#pragma once
// What the command line sets.

#include <filesystem>
#include <string>

namespace quarn::loadbench {

struct BenchOptions {
    std::filesystem::path daemon;            // the quarnd binary to start
    std::filesystem::path socket;            // a running daemon instead (lookup and create only)
    std::filesystem::path work = "/var/tmp"; // where the temporary root goes
    double seconds = 1.0;                    // length of one timed lookup run
    int rounds = 3;                          // daemon and floor runs alternate this often
    int clients = 16;
    int creates = 300;
    int rebuildContainers = 10000;
    int memoryContainers = 100000;
    std::string only;      // one measure ("lookup", "create", "rebuild", "memory"), or all
    bool keepRoot = false; // leave the temporary root (and the daemon's log) behind

    bool runs(const char* measure) const { return only.empty() || only == measure; }
};

} // namespace quarn::loadbench
