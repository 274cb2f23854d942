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
#include <vector>

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

    // Header (with `flags` as the flag byte) and body.
    static std::vector<std::uint8_t> rawFrame(std::span<const std::uint8_t> body,
                                              std::uint8_t flags);
    static std::vector<std::uint8_t> frame(const Value& message, std::uint8_t flags);

private:
    // Reads exactly `into.size()` bytes; false on the end of the stream,
    // an error, or the wait limit.
    bool readExactly(std::span<std::uint8_t> into);

    std::unique_ptr<Descriptor> fd_;
};

} // namespace quarn::test
