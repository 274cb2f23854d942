#pragma once
// Collects the log lines written while it lives, for tests that check that
// a failure was reported with its message.

#include "Daemon/support/Log.h"

#include <spdlog/sinks/base_sink.h>

#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace quarn::test {

class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    // Messages only (no time, level or category).
    std::vector<std::string> messages() const;
    bool contains(std::string_view fragment) const;
    std::size_t count(std::string_view fragment) const;
    std::string all() const; // every message, one per line, for failure output
    void clear();

private:
    class Sink;
    std::shared_ptr<Sink> sink_;
    spdlog::level::level_enum previousLevel_;
};

} // namespace quarn::test
