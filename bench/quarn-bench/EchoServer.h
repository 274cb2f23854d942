#pragma once
// The floor of a request round trip: a server on the same kind of socket,
// speaking the same frame and CBOR, that does nothing but decode each
// request and answer with a reply of the daemon's size (the reply it is
// given, encoded afresh each time). One thread per connection, blocking
// I/O: the least work a server can do per request.

#include "Daemon/support/Value.h"

#include <filesystem>

namespace quarn::loadbench {

class EchoServer {
public:
    EchoServer(std::filesystem::path socket, Value reply);

    // Serves until the process is ended.
    [[noreturn]] void run();

private:
    void serve(int fd) const;

    std::filesystem::path socket_;
    Value reply_;
};

} // namespace quarn::loadbench
