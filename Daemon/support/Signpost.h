#pragma once
// Marks an interval (request processing, a start-up phase, a lock wait) with
// a debug line at its begin and one at its end with the duration, and with
// USDT probes "quarnd:signpost_begin" / "quarnd:signpost_end" for tracing
// tools where the build has <sys/sdt.h>.
//
// The interval ends when the Signpost is destroyed or at `end(detail)`. A
// Signpost can be moved into a completion to end an interval that outlives
// the scope that began it.

#include "Daemon/support/Log.h"

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

namespace quarn {

class Signpost {
public:
    Signpost(LogCategory category, std::string name, std::string detail = {});
    ~Signpost() { end(); }
    Signpost(Signpost&& other) noexcept;
    Signpost& operator=(Signpost&& other) noexcept;
    Signpost(const Signpost&) = delete;
    Signpost& operator=(const Signpost&) = delete;

    const std::string& name() const { return name_; }
    // Pairs the begin and end lines of one interval in the log.
    std::uint64_t identifier() const { return id_; }
    bool isActive() const { return active_; }

    // Ends the interval now; `detail` (e.g. a count of what was done) goes
    // into the end line. Later calls do nothing.
    void end(std::string_view detail = {});

private:
    LogCategory category_;
    std::string name_;
    std::uint64_t id_;
    std::chrono::steady_clock::time_point start_;
    bool active_ = true;
};

} // namespace quarn
