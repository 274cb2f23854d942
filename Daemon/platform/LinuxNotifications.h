#pragma once
// Notifications on Linux: each post appends one line (UTC time and name) to
// "<run>/notifications/<name>", so a listener can watch the file (inotify)
// or read how often and when a notification went out. Under systemd the
// post also becomes the unit's status line.

#include "Daemon/platform/Notifications.h"
#include "Daemon/platform/Paths.h"

#include <filesystem>
#include <string>

namespace quarn {

class LinuxNotifications final : public Notifications {
public:
    explicit LinuxNotifications(Paths paths);

    Status post(std::string_view name) override;

    // "<run>/notifications".
    std::filesystem::path directory() const;
    // "2026-01-02T03:04:05.123456Z com.orvex.quarnd.user-invalidated\n".
    static std::string lineFor(std::string_view name);

private:
    // The notifications directory, made below the root on demand and opened
    // without following links. Answers a descriptor or an errno value.
    Expected<int, int> openDirectory() const;
    static void tellSystemd(std::string_view name);

    Paths paths_;
};

} // namespace quarn
