#pragma once
// Listening Unix stream sockets of the request service: one bound at a path
// of our own, or one systemd passed in.

#include "Daemon/support/QRNError.h"

#include <filesystem>
#include <string_view>

namespace quarn {

class UnixSocketFile {
public:
    // A listening socket bound at `path` (absolute): its parent made (0755)
    // when missing, a stale socket file replaced, the file made 0666. A
    // file that is no socket, or a socket someone still listens on, is left
    // alone and refused.
    static Result<int> listen(const std::filesystem::path& path);

    static bool isListeningStream(int fd);

    // The descriptor systemd passed under `name`, or -1.
    static int fromSystemd(std::string_view name);

private:
    static Status makeParent(const std::filesystem::path& directory);
    static Status removeStale(const std::filesystem::path& path);
    static Status bindAndListen(int fd, const std::filesystem::path& path);
};

} // namespace quarn
