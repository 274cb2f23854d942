#include "Daemon/support/Log.h"

#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

#include <array>
#include <filesystem>
#include <mutex>

namespace quarn {

namespace {

constexpr std::array<const char*, static_cast<std::size_t>(LogCategory::Count_)> kNames = {
    "unspecified", "cache", "sandbox", "vell", "locking",  "database",       "upcall",
    "lifecycle",   "fs",    "startup", "test", "metadata", "codesignmapping"};

// Pattern: time, level, category, the function name, then the message.
constexpr const char* kPattern = "%Y-%m-%d %H:%M:%S.%f %^%l%$ [%n] %!: %v";

struct Loggers {
    std::shared_ptr<spdlog::sinks::dist_sink_mt> sink =
        std::make_shared<spdlog::sinks::dist_sink_mt>();
    std::array<std::shared_ptr<spdlog::logger>, kNames.size()> loggers;

    Loggers() {
        sink->set_pattern(kPattern);
        for (std::size_t i = 0; i < kNames.size(); ++i) {
            loggers[i] = std::make_shared<spdlog::logger>(kNames[i], sink);
            loggers[i]->set_level(spdlog::level::info);
            loggers[i]->flush_on(spdlog::level::err);
        }
    }
};

Loggers& loggers() {
    static Loggers* instance = new Loggers(); // never destroyed: logging works during exit
    return *instance;
}

} // namespace

spdlog::logger& Log::logger(LogCategory category) {
    return *loggers().loggers[static_cast<std::size_t>(category)];
}

const char* Log::categoryName(LogCategory category) {
    return kNames[static_cast<std::size_t>(category)];
}

std::shared_ptr<spdlog::sinks::dist_sink_mt> Log::sink() {
    return loggers().sink;
}

void Log::setLevel(spdlog::level::level_enum level) {
    for (auto& l : loggers().loggers) {
        l->set_level(level);
    }
}

spdlog::level::level_enum Log::levelForSyslogLevel(int syslogLevel) {
    if (syslogLevel <= 2) {
        return spdlog::level::critical;
    }
    if (syslogLevel <= 4) {
        return spdlog::level::err;
    }
    if (syslogLevel <= 6) {
        return spdlog::level::info;
    }
    return spdlog::level::debug;
}

bool Log::isEnabled(spdlog::level::level_enum level) {
    return logger(LogCategory::Unspecified).should_log(level);
}

bool Log::addRotatingFile(const std::string& directory, std::size_t maxBytes,
                          std::size_t maxFiles) {
    try {
        auto path = (std::filesystem::path(directory) / "quarnd.log").string();
        auto file =
            std::make_shared<spdlog::sinks::rotating_file_sink_mt>(path, maxBytes, maxFiles);
        file->set_pattern(kPattern);
        sink()->add_sink(file);
        return true;
    } catch (const spdlog::spdlog_ex& e) {
        QRN_LOG_ERROR(LogCategory::Startup, "Failed to open the log file in {}: {}", directory,
                      e.what());
        return false;
    }
}

void Log::addStderr() {
    auto err = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    err->set_pattern(kPattern);
    sink()->add_sink(err);
}

} // namespace quarn
