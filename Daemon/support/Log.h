#pragma once
// Logging: one spdlog logger per category of the structured log, all writing
// through one distributing sink so that start-up can add the rotating file
// (and tests a capture) after the loggers exist.
//
// Levels of the rotating log: 3 -> error, 5 (notice) -> info, 6 (info) and
// 7 -> debug.
// "fault" messages go out at critical.

#include <spdlog/sinks/dist_sink.h>
#include <spdlog/spdlog.h>

#include <cstddef>
#include <memory>
#include <string>

namespace quarn {

enum class LogCategory : std::size_t {
    Unspecified,
    Cache,
    Sandbox,
    Vell,
    Locking,
    Database,
    Upcall,
    Lifecycle,
    Fs,
    Startup,
    Test,
    Metadata,
    CodeSigningMapping,
    Count_
};

class Log {
public:
    static constexpr const char* kSubsystem = "com.orvex.quarnmanager";

    static spdlog::logger& logger(LogCategory category);
    static const char* categoryName(LogCategory category);

    // The sink every category logger writes through. Sinks added here
    // receive every category's lines.
    static std::shared_ptr<spdlog::sinks::dist_sink_mt> sink();

    // Sets the threshold for every category. Accepts the syslog-style
    // numbers (3 error, 5 notice, 7 debug).
    static void setLevel(spdlog::level::level_enum level);
    static spdlog::level::level_enum levelForSyslogLevel(int syslogLevel);
    static bool isEnabled(spdlog::level::level_enum level);

    // Adds the rotating log file "quarnd.log" in `directory` (size and count
    // as start-up wants them). Returns false (and logs) when it cannot be opened.
    static bool addRotatingFile(const std::string& directory, std::size_t maxBytes,
                                std::size_t maxFiles);

    // Writes to stderr in addition to whatever else is set up.
    static void addStderr();
};

} // namespace quarn

// The arguments are only evaluated when the line is written: descriptions
// passed to debug lines on hot paths cost nothing otherwise.
#define QRN_LOG_AT(category, level, ...)                                                           \
    do {                                                                                           \
        auto& qrnLogger_ = ::quarn::Log::logger(category);                                         \
        if (qrnLogger_.should_log(level)) {                                                        \
            SPDLOG_LOGGER_CALL((&qrnLogger_), level, __VA_ARGS__);                                 \
        }                                                                                          \
    } while (0)
#define QRN_LOG_DEBUG(category, ...) QRN_LOG_AT(category, spdlog::level::debug, __VA_ARGS__)
// Info (6) lies below the default level (5, notice) and spdlog has no level
// between info and debug: info lines are written from the debug level on.
#define QRN_LOG_INFO(category, ...) QRN_LOG_AT(category, spdlog::level::debug, __VA_ARGS__)
#define QRN_LOG_NOTICE(category, ...) QRN_LOG_AT(category, spdlog::level::info, __VA_ARGS__)
#define QRN_LOG_ERROR(category, ...) QRN_LOG_AT(category, spdlog::level::err, __VA_ARGS__)
#define QRN_LOG_FAULT(category, ...) QRN_LOG_AT(category, spdlog::level::critical, __VA_ARGS__)
