#pragma once
// The daemon's command line: the root prefix, logging to stderr, the log
// level, help and version.

#include <spdlog/common.h>

#include <cstddef>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace quarn {

struct QRNDaemonOptions {
    std::filesystem::path root = "/";
    // Also log to stderr (under systemd that is the journal).
    bool foreground = false;
    // Notice: the rotating log's default level.
    spdlog::level::level_enum logLevel = spdlog::level::info;
    // Request workers. Container operations serialise on the global lock,
    // so more workers than this buy little, while each idle one adds thread
    // wake-ups to every request (a third more CPU per lookup with 8).
    std::size_t workerThreads = 4;

    // What parsing decided: run, or stop at once with an exit status after
    // printing `output` (help, version, or what was wrong).
    struct Parsed;
    static Parsed parse(const std::vector<std::string>& arguments);
    static Parsed parse(int argc, const char* const* argv);

    // "error", "notice", "debug" or 3, 5, 7; nothing for anything else.
    static std::optional<spdlog::level::level_enum> levelNamed(const std::string& name);
};

struct QRNDaemonOptions::Parsed {
    QRNDaemonOptions options;
    std::optional<int> exitStatus; // set: do not run
    std::string output;
};

} // namespace quarn
