#pragma once
// The first-boot marker "quarnd.fb_check": a named POSIX semaphore whose
// existence means that the first-boot work has completed since the machine
// started. The name carries a short hash of the root prefix so that daemons
// on different roots do not share it; like the real one it vanishes at
// reboot.

#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/QRNError.h"

#include <filesystem>
#include <string>

namespace quarn {

class FirstBootMarker {
public:
    static constexpr const char* kBaseName = "quarnd.fb_check";

    explicit FirstBootMarker(const std::filesystem::path& rootPrefix);
    // The marker of the context's root, so the context can make it on first use.
    explicit FirstBootMarker(QRNDaemonContext& context) : FirstBootMarker(context.rootPrefix()) {}

    // "/quarnd.fb_check" on the root "/", "/quarnd.fb_check.<hash>" otherwise.
    const std::string& name() const { return name_; }
    // Opens the semaphore without creating it (and closes it again).
    bool exists() const;
    // Creates it with mode 0444 and value 0 (not exclusive) and closes it.
    Status create() const;
    // Unlinks it; absent counts as success.
    Status remove() const;

private:
    std::string name_;
};

} // namespace quarn
