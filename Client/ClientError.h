#pragma once
// Why a typed request did not succeed: the daemon answered with an error
// code, no answer came, or the answer could not be read.

#include "Daemon/support/QRNError.h"

#include <cstdint>
#include <string>

namespace quarn {

struct ClientError {
    enum class Kind {
        Daemon,    // "ReplyError" other than 1
        Transport, // no reply: cannot connect, connection closed, timeout, bad frame
        BadReply,  // a reply without the keys or types the command promises
    };

    Kind kind = Kind::Daemon;
    std::uint64_t code = 0; // the daemon's code; 0 unless kind is Daemon
    std::string name;       // QRNErrorCodeName(code), "NoReply" or "BadReply"
    std::string message;    // what went wrong when kind is not Daemon

    static ClientError fromCode(std::uint64_t code);
    static ClientError transport(const Error& error);
    static ClientError badReply(std::string message);

    // "error 21 (ContainerNotFound)", "no reply: <why>", "bad reply: <why>".
    std::string description() const;
};

template <class T> using ClientResult = Expected<T, ClientError>;

} // namespace quarn
