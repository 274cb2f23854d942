#pragma once
// Both ends of the request service's socket for test servers, test clients
// and the load tool: connect, listen and accept, and whole frames read and
// written with blocking calls. A socket with a receive timeout
// (SO_RCVTIMEO) bounds every read.

#include "Daemon/platform/IpcFrame.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>
#include <span>
#include <vector>

namespace quarn::test {

class FrameSocket {
public:
    static constexpr std::size_t kMaxFrameBytes = 1024 * 1024;

    struct Frame {
        IpcFrame::Header header;
        Result<Value> message; // the body decoded
    };

    // A connected stream socket for the caller to own; -1 (errno set)
    // when nothing accepts.
    static int connectTo(const std::filesystem::path& socketPath);
    // The same once the daemon's greeting has been read from it; -1 (errno
    // EPROTO for a missing or wrong greeting) otherwise.
    static int connectGreeted(const std::filesystem::path& socketPath);
    // Reads the greeting a server sends first; false when the next frame
    // is not one.
    static bool readGreeting(int fd);
    // What a stand-in server sends first.
    static bool writeGreeting(int fd);
    // Whether something accepts on `socketPath` now.
    static bool accepts(const std::filesystem::path& socketPath);
    // A listening stream socket at `socketPath` (a stale one replaced) for
    // the caller to own; -1 (errno set) when it cannot be made.
    static int listenAt(const std::filesystem::path& socketPath, int backlog);
    // Hands every accepted connection to `serve`, which owns it; returns
    // when accepting fails for another reason than a signal or an aborted
    // connection (the listener was shut down).
    static void acceptEach(int listener, const std::function<void(int fd)>& serve);

    // The next frame, its body read into `body`; none at the end of the
    // stream, on a failed or timed-out read, a reserved flag bit, or a
    // frame over kMaxFrameBytes.
    static std::optional<Frame> readFrame(int fd, std::vector<std::uint8_t>& body);
    static bool readExactly(int fd, std::span<std::uint8_t> into);
    static bool writeAll(int fd, std::span<const std::uint8_t> bytes);

    // A header declaring `length` with `flags` as its flag byte, then
    // `body`: also frames no well-behaved peer writes.
    static std::vector<std::uint8_t> rawFrame(std::uint32_t length, std::uint8_t flags,
                                              std::span<const std::uint8_t> body);
    // `message` encoded, in a frame of its size.
    static std::vector<std::uint8_t> frame(const Value& message, std::uint8_t flags);
};

} // namespace quarn::test
