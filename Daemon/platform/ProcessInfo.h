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
#include <vector>

namespace quarn {

class ProcessInfo {
public:
    struct Ids {
        std::uint32_t realUID = 0;
        std::uint32_t effectiveUID = 0;
        std::uint32_t realGID = 0;
        std::uint32_t effectiveGID = 0;
    };
    // What decides whether a process may hold entitlements, from "status".
    struct Standing {
        std::uint32_t effectiveUID = 0;
        std::uint32_t effectiveGID = 0;
        std::vector<std::uint32_t> groups; // supplementary
        pid_t tracer = 0;                  // 0 when nothing traces it
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
    Expected<Standing, int> standing() const;
    // The first variable of the initial environment that makes the dynamic
    // loader run code the program did not name ("LD_PRELOAD=..."), or ""
    // when there is none. An environment too large to read whole counts as
    // one (EFBIG), an empty one as unreadable (EAGAIN: a process in the
    // middle of an execve shows none).
    Expected<std::string, int> loaderInjection() const;

    // Parsers of the file contents; none for anything malformed.
    static std::optional<std::uint64_t> parseStartTime(std::string_view stat);
    static std::optional<Ids> parseIds(std::string_view status);
    static std::optional<std::uint32_t> parseLoginUID(std::string_view text);
    static std::optional<Standing> parseStanding(std::string_view status);
    // Over the NUL-separated "environ".
    static std::string findLoaderInjection(std::string_view environ);

private:
    explicit ProcessInfo(std::shared_ptr<Descriptor> directory)
        : directory_(std::move(directory)) {}
    Expected<std::string, int> read(const char* name, std::size_t maxBytes = kMaxFileBytes) const;

    // "status" grows with the supplementary groups; the lines read first come first.
    static constexpr std::size_t kMaxFileBytes = 64 * 1024;

    std::shared_ptr<Descriptor> directory_;
};

} // namespace quarn
