#pragma once
// Tells, without blocking, whether the entries of a directory may have
// changed since it was last asked. Built on inotify; while the directory is
// absent its nearest existing ancestor is watched instead, so that its
// appearance is seen too.

#include "Daemon/support/Descriptor.h"

#include <poll.h>

#include <atomic>
#include <filesystem>

namespace quarn {

class DirectoryChangeMonitor {
public:
    explicit DirectoryChangeMonitor(std::filesystem::path directory);
    DirectoryChangeMonitor(const DirectoryChangeMonitor&) = delete;
    DirectoryChangeMonitor& operator=(const DirectoryChangeMonitor&) = delete;

    // Whether events wait to be consumed (or the monitor has never been
    // asked, or cannot watch at all). Safe from any thread; reads nothing.
    bool hasPendingChanges() const;
    // The same, polling `other` (whose revents are set) in the same system
    // call, for a caller that checks both on a hot path.
    bool hasPendingChangesPolling(pollfd& other) const;

    // True on the first call, and whenever a change may have happened since
    // the previous call; consumes the pending events. The watch is (re)made
    // here, before the caller rereads the directory, so nothing is missed
    // between the two. Callers serialise the calls.
    bool consumeChanges();

private:
    // Drains the pending events; true when any came. `rearm` is set when the
    // watched directory went away or was an ancestor stand-in.
    bool drain(bool& rearm);
    void arm();

    std::filesystem::path directory_;
    Descriptor inotify_;
    // Owned by the serialised consumeChanges() callers.
    int watch_ = -1;
    bool watchingDirectory_ = false;
    // Written there too, but read by hasPendingChanges() from any thread.
    std::atomic<bool> armed_{false};
};

} // namespace quarn
