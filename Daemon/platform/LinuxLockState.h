#pragma once
// LockState from the file "<run>/lockstate", a decimal state; no file means
// unlocked. Changes are followed with inotify on the run directory, so a
// file written in place, renamed over, or removed is all seen.

#include "Daemon/platform/LockState.h"
#include "Daemon/platform/Paths.h"

#include <memory>
#include <mutex>
#include <optional>
#include <string_view>
#include <thread>

namespace quarn {

class LinuxLockState final : public LockState {
public:
    // Reported when the file holds something that is no state, or cannot be
    // read: a transitional state, so that nobody acts on it.
    static constexpr std::int32_t kUnreadable = -1;

    explicit LinuxLockState(Paths paths);
    ~LinuxLockState() override;
    LinuxLockState(const LinuxLockState&) = delete;
    LinuxLockState& operator=(const LinuxLockState&) = delete;

    std::int32_t state() const override;
    Status startWatching(Callback callback) override;
    void stopWatching() override;

    static std::optional<std::int32_t> parseState(std::string_view contents);

private:
    struct Watch;

    static std::int32_t readState(const std::filesystem::path& file);
    Result<std::shared_ptr<Watch>> makeWatch(Callback callback) const;
    static void run(const std::shared_ptr<Watch>& watch);
    static void stop(const std::shared_ptr<Watch>& watch, std::thread& thread);

    std::filesystem::path directory_;
    std::filesystem::path file_;

    // Guards watch_ and thread_: start and stop may come from any thread,
    // the watcher's own included.
    std::mutex mutex_;
    std::shared_ptr<Watch> watch_;
    std::thread thread_;
};

} // namespace quarn
