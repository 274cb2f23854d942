#pragma once
// The request service: a Unix stream socket (or the one systemd hands over)
// accepting client connections, and a pool of worker threads on which the
// requests of one connection run one at a time while different connections
// run concurrently. Each connection stays on one worker thread, given round
// robin.
//
// Who the client is gets settled before it may write: the connecting
// process is pinned at accept, the handler identifies it, and resume()
// sends the greeting (a frame with flag byte 0 holding {"QuarnProtocol": 1});
// a byte that arrived before it closes the connection, since it may have
// been written by the program the process ran before an execve. Every
// message must then come from the pinned process with the real uid and gid
// it had at accept, still running the same program, else the connection is
// closed with a log line.
//
// Frame: a 4-byte little-endian length N, one flag byte (bit 0: the sender
// expects a reply; other bits must be clear), then N bytes holding one CBOR
// map. A frame over the size limit, a bad flag byte or a message that does
// not decode closes that connection with a log line.

#include "Daemon/platform/IpcConnection.h"
#include "Daemon/support/QRNError.h"

#include <chrono>
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
        // Decoded items (scalars and keys one each, arrays and maps
        // CborCodec::kContainerCost) one message may hold: room for the
        // largest request a frame carries (command 3's four parallel arrays
        // of 25,000 containers each), and met long before 1 MiB of one-byte
        // items or empty maps has cost a Value (and an allocation) each.
        std::size_t maxDecodedItems = 256 * 1024;
        // Each open connection holds a socket, a pidfd, a /proc directory and
        // a read buffer; past this many, new ones are closed at once with a
        // log line instead of exhausting the daemon's descriptors (the soft
        // limit is 1024, and tree walks need theirs) or memory.
        std::size_t maxConnections = 256;
        // No uid other than root holds more than this many of them...
        std::size_t maxConnectionsPerUID = 64;
        // ...and the last ones are root's alone.
        std::size_t rootReservedConnections = 16;
        // A frame begun and not finished within this closes its connection.
        std::chrono::milliseconds partialFrameTimeout{10000};
        // Once more than this many connections are open, those idle (no
        // request in flight, nothing buffered either way) for longer than
        // `idleTimeout` are closed at the next accept, the uid holding most
        // slots first.
        std::size_t reapIdleAbove = 192;
        std::chrono::milliseconds idleTimeout{30000};
        // After a large frame or message has been freed, the heap is given
        // back to the system at most this often.
        std::chrono::milliseconds memoryTrimInterval{1000};
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
