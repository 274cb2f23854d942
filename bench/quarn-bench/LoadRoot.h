#pragma once
// The temporary root the daemon under test runs on: its own accounts
// ("mobile" 501/501 with home "/private/var/mobile", "systemusers",
// "_installd" 33), an os-release, and a code-signing registry entry that
// gives this tool's executable full access. A daemon context on the same
// root, current in this process, lets the tool lay out containers exactly
// where and how the daemon would. Removed, with the root's first-boot
// marker, when the tool ends.

#include "common/shared/ScratchRoot.h"

#include <filesystem>

namespace quarn::loadbench {

class LoadRoot {
public:
    // A fresh root in a new directory below `base`; `keep` leaves it there.
    LoadRoot(const std::filesystem::path& base, bool keep);
    ~LoadRoot();
    LoadRoot(const LoadRoot&) = delete;
    LoadRoot& operator=(const LoadRoot&) = delete;

    const std::filesystem::path& path() const { return root_.path(); }
    QRNDaemonContext& context() { return root_.context(); }
    std::filesystem::path socketPath() const;
    // Lines in the notification file of `name` (one per post).
    std::size_t notificationCount(const char* name) const;

private:
    void writeRegistryEntry() const;

    test::ScratchRoot root_;
    bool keep_;
};

} // namespace quarn::loadbench
