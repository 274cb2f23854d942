#pragma once
// A connection to quarnd's request service. Each request goes out as one
// frame with the reply flag set and is answered by one reply frame; requests
// on one connection are answered in order, so a QRNClient serves one thread
// at a time (open one per thread for concurrent requests).
//
// Any failure to send or to read a whole reply closes the connection: the
// stream would be out of step afterwards.

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <span>
#include <string_view>
#include <vector>

namespace quarn {

class QRNClient {
public:
    static constexpr std::string_view kSocketName = "com.orvex.quarnd.sock";

    struct Options {
        // Longest wait for one read or write (and for the connection to be
        // accepted); zero waits forever.
        std::chrono::milliseconds timeout{60000};
        // Replies and requests above this are refused; the daemon's own limit.
        std::size_t maxMessageBytes = 1024 * 1024;
        std::size_t maxNesting = 32;
    };

    // "<root>/private/var/run/quarnd/com.orvex.quarnd.sock".
    static std::filesystem::path socketPathForRoot(const std::filesystem::path& rootPrefix);

    // Fails with the POSIX error of socket or connect (ENOENT, ECONNREFUSED,
    // EACCES, ...), ENAMETOOLONG for a path a socket address cannot hold,
    // EPROTO when the daemon's first frame is no greeting of this protocol,
    // ECONNRESET when it closed without one. Returns once greeted.
    static Result<QRNClient> connect(const std::filesystem::path& socketPath, Options options);
    static Result<QRNClient> connect(const std::filesystem::path& socketPath) {
        return connect(socketPath, Options{});
    }
    // Takes over a connected stream socket (a socketpair end in tests).
    static Result<QRNClient> adopt(int socketFd, Options options);

    QRNClient(QRNClient&&) noexcept = default;
    QRNClient& operator=(QRNClient&&) noexcept = default;
    ~QRNClient() = default;

    // Sends `request` and returns the reply dictionary. Errors are POSIX:
    // ENOTCONN (closed before), EMSGSIZE (request or reply over the limit),
    // ECONNRESET (closed by the daemon, also mid-reply), ETIMEDOUT, EPROTO
    // (bad frame header or bytes after the reply), EBADMSG (reply does not
    // decode or is no dictionary), or the errno of the failing call.
    Result<Value> send(const Value& request);

    bool isConnected() const { return fd_ != nullptr; }
    void close() { fd_.reset(); }
    // The socket, for poll loops of callers; -1 once closed.
    int fd() const { return fd_ ? fd_->get() : -1; }

private:
    QRNClient(std::unique_ptr<Descriptor> fd, Options options)
        : fd_(std::move(fd)), options_(options) {}

    Status writeAll(std::span<const std::uint8_t> bytes);
    Result<std::size_t> readSome(std::span<std::uint8_t> into);
    // Reads into `buffer` after its first `have` bytes until at least `want`
    // are there; returns how many are.
    Result<std::size_t> readAtLeast(std::vector<std::uint8_t>& buffer, std::size_t have,
                                    std::size_t want);
    // The next frame from the daemon: a reply, or its greeting.
    Result<Value> readFrame(bool isReply);
    static Result<QRNClient> greeted(QRNClient client);

    std::unique_ptr<Descriptor> fd_;
    Options options_;
};

} // namespace quarn
