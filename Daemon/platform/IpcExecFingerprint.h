#pragma once
// What changes when a process runs another program: the device and inode
// of its executable and the address-space layout of /proc/<pid>/stat
// (start and end of code, start of stack, bounds of the arguments and the
// environment), which execve lays out anew, at random addresses under ASLR.
//
// Read at accept through a /proc/<pid> directory opened while the pidfd
// shows the process alive, so a recycled pid can never be read instead; a
// check then costs one pread of the kept "stat" descriptor and one stat of
// "exe". A process that has exited no longer matches.

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/QRNError.h"

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>

namespace quarn {

class IpcExecFingerprint {
public:
    // The stat fields 26-28 and 48-51 (startcode, endcode, startstack,
    // arg_start, arg_end, env_start, env_end).
    using Layout = std::array<std::uint64_t, 7>;

    // Of the process `pidfd` pins under `pid`.
    static Result<IpcExecFingerprint> of(pid_t pid, int pidfd);

    // Whether the process still runs the program it ran when taken.
    bool matches() const;

    static std::optional<Layout> parseLayout(std::string_view stat);

private:
    struct Now {
        dev_t device = 0;
        ino_t inode = 0;
        Layout layout{};
        bool operator==(const Now&) const = default;
    };
    IpcExecFingerprint(std::shared_ptr<Descriptor> directory, std::shared_ptr<Descriptor> stat)
        : directory_(std::move(directory)), stat_(std::move(stat)) {}
    std::optional<Now> read() const;

    std::shared_ptr<Descriptor> directory_;
    std::shared_ptr<Descriptor> stat_;
    Now taken_;
};

} // namespace quarn
