#pragma once
// Posting of the daemon's system-wide notifications (cleanup complete, reboot
// cleanup complete, a user identity invalidated). Listeners outside the
// daemon follow them; posting never blocks on a listener.

#include "Daemon/support/QRNError.h"

#include <string_view>

namespace quarn {

class Notifications {
public:
    static constexpr std::string_view kCleanupComplete = "com.orvex.quarnd.cleanup-complete";
    static constexpr std::string_view kRebootCleanupComplete =
        "com.orvex.quarnd.reboot-cleanup-complete";
    static constexpr std::string_view kUserInvalidated = "com.orvex.quarnd.user-invalidated";

    // Longest name accepted; names become file names, which allow 255 bytes.
    static constexpr std::size_t kMaxNameLength = 200;

    virtual ~Notifications() = default;

    virtual Status post(std::string_view name) = 0;

    // A name is a non-empty run of letters, digits, '.', '-' and '_' that
    // does not begin with '.': safe as a file name, never a path.
    static bool isValidName(std::string_view name);
};

} // namespace quarn
