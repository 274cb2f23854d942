#pragma once
// A connection to the daemon's socket that sends whatever bytes a test
// gives it, for frames no well-behaved client would send. Reads wait at
// most DaemonHarness::kWaitLimit.

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <span>

namespace quarn::test {

class RawConnection {
public:
    // Throws when the socket does not accept.
    explicit RawConnection(const std::filesystem::path& socketPath);

    bool write(std::span<const std::uint8_t> bytes);
    // No more bytes from this side; the daemon reads the end of the stream.
    void shutdownWrite();
    void close() { fd_.reset(); }

    // The next reply frame, decoded; none when the connection ends first
    // or what arrives is no valid reply.
    std::optional<Value> readReply();
    // True when the daemon ends the connection before sending anything.
    bool waitForClose();

private:
    std::unique_ptr<Descriptor> fd_;
};

} // namespace quarn::test
