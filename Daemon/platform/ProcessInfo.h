#pragma once
// What the request service reads about a live process from /proc. This is
// the host's /proc, never taken below the root prefix: it describes the
// processes of the kernel the daemon runs on.
//
// The files are read through a descriptor of /proc/<pid>, so a pid reused
// after open() makes the reads fail instead of describing the newcomer.

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Expected.h"

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class ProcessInfo {
public:
    struct Ids {
        std::uint32_t realUID = 0;
        std::uint32_t effectiveUID = 0;
        std::uint32_t realGID = 0;
        std::uint32_t effectiveGID = 0;
    };
    // The login uid of a process no login session owns.
    static constexpr std::uint32_t kNoLoginUID = 0xFFFFFFFF;

    // Failures carry the errno (ESRCH or ENOENT for a process that is gone).
    static Expected<ProcessInfo, int> open(pid_t pid);

    // Clock ticks since boot, field 22 of "stat".
    Expected<std::uint64_t, int> startTime() const;
    // The "Uid:" and "Gid:" lines of "status".
    Expected<Ids, int> ids() const;
    // "loginuid"; kNoLoginUID when the kernel keeps none.
    Expected<std::uint32_t, int> loginUID() const;

    // Parsers of the file contents; none for anything malformed.
    static std::optional<std::uint64_t> parseStartTime(std::string_view stat);
    static std::optional<Ids> parseIds(std::string_view status);
    static std::optional<std::uint32_t> parseLoginUID(std::string_view text);

private:
    explicit ProcessInfo(std::shared_ptr<Descriptor> directory)
        : directory_(std::move(directory)) {}
    Expected<std::string, int> read(const char* name) const;

    std::shared_ptr<Descriptor> directory_;
};

} // namespace quarn
