#pragma once
// The request service: a Unix stream socket (or the one systemd hands over)
// accepting client connections, and a pool of worker threads on which the
// requests of one connection run one at a time while different connections
// run concurrently. Each connection stays on one worker thread, given round
// robin; each message carries the credentials of the process that wrote it.
//
// Frame: a 4-byte little-endian length N, one flag byte (bit 0: the sender
// expects a reply; other bits must be clear), then N bytes holding one CBOR
// map. A frame over the size limit, a bad flag byte or a message that does
// not decode closes that connection with a log line.

#include "Daemon/platform/IpcConnection.h"
#include "Daemon/support/QRNError.h"

#include <cstddef>
#include <filesystem>
#include <functional>
#include <memory>
#include <string_view>

namespace quarn {

class IpcListener {
public:
    struct Options {
        // Bound (mode 0666, a stale socket file replaced) unless
        // `inheritedFd` is a listening socket to adopt.
        std::filesystem::path socketPath;
        int inheritedFd = -1;
        std::size_t workerThreads = 4;
        std::size_t maxFrameBytes = 1024 * 1024;
        std::size_t maxNesting = 32;
        // Each open connection holds a socket, a pidfd per writer and up to
        // a frame of buffer; past this many, new ones are closed at once with
        // a log line instead of exhausting the daemon's descriptors (the soft
        // limit is 1024, and tree walks need theirs) or memory.
        std::size_t maxConnections = 256;
    };
    // Called on a pool thread for each accepted connection, which reads
    // nothing until it is resumed.
    using ConnectionHandler = std::function<void(std::shared_ptr<IpcConnection>)>;

    explicit IpcListener(Options options);
    ~IpcListener(); // stop()
    IpcListener(const IpcListener&) = delete;
    IpcListener& operator=(const IpcListener&) = delete;

    Status start(ConnectionHandler onConnection);
    // Closes the listening socket; connections already open go on.
    void stopAccepting();
    // Stops accepting, ends every connection and joins the pool.
    void stop();

    // The listening socket systemd passed under `name` (LISTEN_FDS with
    // LISTEN_FDNAMES), or -1.
    static int socketFromSystemd(std::string_view name);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

} // namespace quarn
